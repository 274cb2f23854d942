#pragma once
// The policy that chooses data protection classes for containers. The
// current daemon context owns the one instance (`defaultManager`).
//
// The class an app asks for comes from its code-signing entitlements. The
// code-signing mapping lives beside this layer, not below it, so the owner
// of both hands its entitlements lookup in (`setEntitlementsSource`); with
// none, no identifier has entitlements and every answer is 0.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>
#include <string_view>

namespace quarn {

class QRNDaemonContext;

class QRNDataProtectionManager {
public:
    using EntitlementsSource = std::function<std::optional<Value>(std::string_view identifier)>;

    // The platform's names for its protection levels, as entitlements give them.
    static constexpr std::string_view kProtectionComplete = "OrvexProtectionComplete";
    static constexpr std::string_view kProtectionCompleteUnlessOpen =
        "OrvexProtectionCompleteUnlessOpen";
    static constexpr std::string_view kProtectionCompleteUntilFirstUserAuthentication =
        "OrvexProtectionCompleteUntilFirstUserAuthentication";
    static constexpr std::string_view kProtectionNone = "OrvexProtectionNone";
    static constexpr std::string_view kProtectionWriteOnly = "OrvexProtectionWriteOnly";
    static constexpr std::string_view kProtectionCompleteUntilUserAuthentication =
        "OrvexProtectionCompleteUntilUserAuthentication";

    explicit QRNDataProtectionManager(QRNDaemonContext& context);
    QRNDataProtectionManager(const QRNDataProtectionManager&) = delete;
    QRNDataProtectionManager& operator=(const QRNDataProtectionManager&) = delete;

    static QRNDataProtectionManager& defaultManager();

    void setEntitlementsSource(EntitlementsSource source);

    // The class the identifier's entitlements ask for; 0 when they ask for none.
    std::int32_t
    intendedDataProtectionClassBasedOnEntitlementsForIdentifier(std::string_view identifier);
    // The same for an entitlements dictionary at hand.
    static std::int32_t intendedDataProtectionClassForEntitlements(const Value& entitlements);

private:
    // Guards source_.
    std::mutex sourceMutex_;
    EntitlementsSource source_;
};

} // namespace quarn
