#pragma once
// Which group containers an owner's entitlements name. The current daemon
// context owns the one instance.
//
// The owner's identifier lock lives above this layer, so callers that want
// the lookup serialised with other work on the owner take that lock
// themselves (the client connection does).

#include "Daemon/support/QRNError.h"

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class QRNDaemonContext;
class QRNUserIdentityCache;

class QRNGroupManager {
public:
    explicit QRNGroupManager(QRNDaemonContext& context);
    QRNGroupManager(const QRNGroupManager&) = delete;
    QRNGroupManager& operator=(const QRNGroupManager&) = delete;

    static QRNGroupManager& defaultManager();

    QRNUserIdentityCache& userIdentityCache() const { return userIdentityCache_; }

    // The group identifiers of class 13 (system groups) or any other class
    // (application groups) that the owner's entitlements name; empty when the
    // owner has no record. An empty owner or a record that holds no array
    // fails with 11.
    CodeResult<std::vector<std::string>>
    groupContainerIdentifiersForOwnerIdentifier(std::string_view owner,
                                                std::uint64_t groupContainerClass);

private:
    CodeResult<std::vector<std::string>> _groupIdentifiers(std::string_view owner,
                                                           std::uint64_t groupContainerClass);

    QRNUserIdentityCache& userIdentityCache_;
};

} // namespace quarn
