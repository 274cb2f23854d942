#include "Daemon/codesigning/QRNCodeSigningMapping.h"

#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/QRNError.h"

namespace quarn {

QRNCodeSigningMapping::QRNCodeSigningMapping(QRNDaemonContext&) {}

QRNCodeSigningMapping& QRNCodeSigningMapping::sharedInstance() {
    return QRNDaemonContext::current().instance<QRNCodeSigningMapping>();
}

std::optional<Value> QRNCodeSigningMapping::entitlementsForIdentifier(std::string_view) {
    return std::nullopt;
}

bool QRNCodeSigningMapping::identifierHasSystemContainer(std::string_view identifier) {
    const std::optional<Value> entitlements = entitlementsForIdentifier(identifier);
    if (!entitlements) {
        return false;
    }
    const Value* granted = entitlements->get("com.orvex.security.system-container");
    return granted && granted->asBool().value_or(false);
}

std::optional<std::string>
QRNCodeSigningMapping::parentIdentifierForChildIdentifier(std::string_view) {
    return std::nullopt;
}

std::vector<std::string>
QRNCodeSigningMapping::childBundleIdentifiersForParentIdentifier(std::string_view) {
    return {};
}

std::optional<Value> QRNCodeSigningMapping::appGroupIdentifiersForIdentifier(std::string_view) {
    return std::nullopt;
}

std::optional<Value> QRNCodeSigningMapping::systemGroupIdentifiersForIdentifier(std::string_view) {
    return std::nullopt;
}

std::uint64_t QRNCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string&, const std::shared_ptr<QRNCommandQueue>&) {
    // No records, so nothing to clear and no group loses a reference.
    return kQRNErrorNone;
}

std::uint64_t QRNCodeSigningMapping::processCallerRegisteredEntitlements(
    const Value&, const std::string&, const std::shared_ptr<QRNCommandQueue>&) {
    return kQRNErrorNone;
}

Status QRNCodeSigningMapping::removeAllAdvanceCopiesWithError() {
    return {};
}

} // namespace quarn
