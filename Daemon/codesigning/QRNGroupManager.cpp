#include "Daemon/codesigning/QRNGroupManager.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentityCache.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <cstdlib>
#include <exception>
#include <typeinfo>

namespace quarn {

QRNGroupManager::QRNGroupManager(QRNDaemonContext& context)
    : userIdentityCache_(context.instance<QRNUserIdentityCache>()) {}

QRNGroupManager& QRNGroupManager::defaultManager() {
    return QRNDaemonContext::current().instance<QRNGroupManager>();
}

CodeResult<std::vector<std::string>>
QRNGroupManager::groupContainerIdentifiersForOwnerIdentifier(std::string_view owner,
                                                             std::uint64_t groupContainerClass) {
    try {
        return _groupIdentifiers(owner, groupContainerClass);
    } catch (const std::exception& exception) {
        QRN_ERROR(kQRNErrorException, "Got exception: {} : {}", typeid(exception).name(),
                  exception.what());
        if (QRNGlobalConfiguration::sharedInstance().isInternalImage()) {
            QRN_LOG_FAULT(LogCategory::Unspecified,
                          "** INTERNAL ERROR: Uncaught Exception **\n{} : {}",
                          typeid(exception).name(), exception.what());
            std::abort();
        }
        return QRN_CODE(kQRNErrorException);
    }
}

CodeResult<std::vector<std::string>>
QRNGroupManager::_groupIdentifiers(std::string_view owner, std::uint64_t groupContainerClass) {
    if (owner.empty()) {
        QRN_ERROR(kQRNErrorInvalidArgument, "Can't act on an invalid object: ID: {}", "(null)");
        return QRN_CODE(kQRNErrorInvalidArgument);
    }
    QRNCodeSigningMapping& mapping = QRNCodeSigningMapping::sharedInstance();
    const std::optional<Value> found = groupContainerClass == kQRNContainerClassSystemGroup
                                           ? mapping.systemGroupIdentifiersForIdentifier(owner)
                                           : mapping.appGroupIdentifiersForIdentifier(owner);
    std::vector<std::string> identifiers;
    if (!found || found->isNone()) {
        return identifiers;
    }
    const Value::Array* elements = found->asArray();
    if (!elements) {
        QRN_ERROR(kQRNErrorInvalidArgument, "Wrong group id obj type for ID: {} : {}", owner,
                  found->description());
        return QRN_CODE(kQRNErrorInvalidArgument);
    }
    for (const Value& element : *elements) {
        // The mapping keeps only strings; anything else is no group name.
        if (const std::string* identifier = element.asString()) {
            identifiers.push_back(*identifier);
        }
    }
    return identifiers;
}

} // namespace quarn
