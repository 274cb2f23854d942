#include "Daemon/protection/QRNDataProtectionManager.h"

#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <array>
#include <utility>

namespace quarn {

namespace {

// Looked for in this order; the first one present decides.
constexpr std::array<std::string_view, 3> kEntitlementKeys = {
    "com.orvex.developer.default-data-protection", "data-protection-class", "DataProtectionClass"};

constexpr std::int32_t kUnknownLevelClass = 0;

std::optional<std::int32_t> classForLevelName(std::string_view name) {
    using M = QRNDataProtectionManager;
    static constexpr std::array<std::pair<std::string_view, std::int32_t>, 6> kLevels = {{
        {M::kProtectionComplete, 1},
        {M::kProtectionCompleteUnlessOpen, 2},
        {M::kProtectionCompleteUntilFirstUserAuthentication, 3},
        {M::kProtectionNone, 4},
        {M::kProtectionWriteOnly, 2},
        {M::kProtectionCompleteUntilUserAuthentication, 3},
    }};
    for (const auto& [level, protectionClass] : kLevels) {
        if (level == name) {
            return protectionClass;
        }
    }
    return std::nullopt;
}

} // namespace

QRNDataProtectionManager::QRNDataProtectionManager(QRNDaemonContext&) {}

QRNDataProtectionManager& QRNDataProtectionManager::defaultManager() {
    return QRNDaemonContext::current().instance<QRNDataProtectionManager>();
}

void QRNDataProtectionManager::setEntitlementsSource(EntitlementsSource source) {
    std::lock_guard guard(sourceMutex_);
    source_ = std::move(source);
}

std::int32_t QRNDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    std::string_view identifier) {
    EntitlementsSource source;
    {
        std::lock_guard guard(sourceMutex_);
        source = source_;
    }
    if (!source) {
        return 0;
    }
    const std::optional<Value> entitlements = source(identifier);
    return entitlements ? intendedDataProtectionClassForEntitlements(*entitlements) : 0;
}

std::int32_t
QRNDataProtectionManager::intendedDataProtectionClassForEntitlements(const Value& entitlements) {
    for (std::string_view key : kEntitlementKeys) {
        const Value* value = entitlements.get(key);
        if (!value) {
            continue;
        }
        const std::string* name = value->asString();
        if (!name) {
            return 0;
        }
        if (std::optional<std::int32_t> protectionClass = classForLevelName(*name)) {
            return *protectionClass;
        }
        QRN_LOG_ERROR(
            LogCategory::Unspecified,
            "Unknown value for DataProtectionClass entitlement: {}; defaulting to class {}", *name,
            kUnknownLevelClass);
        return kUnknownLevelClass;
    }
    return 0;
}

} // namespace quarn
