#pragma once
// Which entitlements, group containers and system containers belong to a
// code-signing identifier. The current daemon context owns the one instance.
//
// This is the mapping as it answers over an empty code-signing database: no
// identifier has entitlements, a parent or a system container, and there is
// never anything to register or remove. The database-backed mapping keeps
// these signatures and fills in the bodies.

#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class QRNCommandQueue;
class QRNDaemonContext;

class QRNCodeSigningMapping {
public:
    explicit QRNCodeSigningMapping(QRNDaemonContext& context);
    virtual ~QRNCodeSigningMapping() = default;
    QRNCodeSigningMapping(const QRNCodeSigningMapping&) = delete;
    QRNCodeSigningMapping& operator=(const QRNCodeSigningMapping&) = delete;

    static QRNCodeSigningMapping& sharedInstance();

    // The "com.orvex.Quarn.Entitlements" dictionary of the identifier's record.
    std::optional<Value> entitlementsForIdentifier(std::string_view identifier);
    // Whether the identifier's entitlements grant it a system container.
    bool identifierHasSystemContainer(std::string_view identifier);
    std::optional<std::string> parentIdentifierForChildIdentifier(std::string_view identifier);
    std::vector<std::string> childBundleIdentifiersForParentIdentifier(std::string_view identifier);
    // The application and system group identifiers the identifier's stored
    // entitlements name; none without a record. Virtual so that tests can
    // stand in a mapping with records.
    virtual std::optional<Value> appGroupIdentifiersForIdentifier(std::string_view identifier);
    virtual std::optional<Value> systemGroupIdentifiersForIdentifier(std::string_view identifier);

    // Both answer a QRNErrorDomain code, 1 meaning success; deletions they
    // cause are inserted into `commandQueue`.
    std::uint64_t removeCodeSigningDictionariesForIdentifierAndItsChildren(
        const std::string& identifier, const std::shared_ptr<QRNCommandQueue>& commandQueue);
    std::uint64_t
    processCallerRegisteredEntitlements(const Value& entitlements, const std::string& identifier,
                                        const std::shared_ptr<QRNCommandQueue>& commandQueue);
    // Drops every record that is only an advance copy.
    Status removeAllAdvanceCopiesWithError();
};

} // namespace quarn
