// The kernel sandbox's container mapping: pushed for every permanent data
// and group container the cache knows, removed when it goes, and read back
// to answer a lookup without a class-directory scan.

#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"

#include <cerrno>

namespace quarn {

namespace {

constexpr std::uint64_t kItemTypeData = 1;
constexpr std::uint64_t kItemTypeAppGroup = 2;
constexpr std::uint64_t kItemTypeSystemData = 4;
constexpr std::uint64_t kItemTypeSystemGroup = 8;

} // namespace

std::uint64_t QRNContainerCache::sandboxItemTypeForClass(std::uint64_t cls) {
    switch (cls) {
    case kQRNContainerClassAppData:
    case kQRNContainerClassPluginData:
    case kQRNContainerClassVPNData:
    case kQRNContainerClassVellService:
    case kQRNContainerClassInternalDaemon:
    case kQRNContainerClassTempDir:
        return kItemTypeData;
    case kQRNContainerClassAppGroup:
        return kItemTypeAppGroup;
    case kQRNContainerClassSystemData:
        return kItemTypeSystemData;
    case kQRNContainerClassSystemGroup:
        return kItemTypeSystemGroup;
    default:
        return 0;
    }
}

std::optional<QRNContainerCache::SandboxMapping>
QRNContainerCache::sandboxMappingFor(const QRNUserIdentity& userIdentity,
                                     const std::string& identifier, std::uint64_t cls,
                                     const std::string& url) {
    const std::uint64_t itemType = sandboxItemTypeForClass(cls);
    if (itemType == 0) {
        if (!QRNContainerClass::isBundle(cls)) {
            QRN_LOG_ERROR(LogCategory::Sandbox,
                          "Unsupported class for setting sandbox container mapping: {}", cls);
        }
        return std::nullopt;
    }
    SandboxMapping mapping;
    // System containers belong to no user: the sandbox files them under root.
    mapping.uid = QRNContainerClass::isSystem(cls) ? 0 : userIdentity.posixUID();
    mapping.item.itemType = itemType;
    mapping.item.identifier = identifier;
    mapping.item.containerClass = cls;
    mapping.item.personaID = static_cast<std::int32_t>(userIdentity.kernelPersonaID());
    mapping.item.path = url;
    return mapping;
}

int QRNContainerCache::pushSandboxMapping(const SandboxMapping& mapping) {
    const SandboxItem& item = mapping.item;
    const int err = sandbox_->setContainerMapping(mapping.uid, item);
    if (err != 0) {
        QRN_LOG_ERROR(LogCategory::Sandbox,
                      "Failed to set mapping for user: {}, itemType: {}, "
                      "identifier {}, class: {}, "
                      "path: {} : {}",
                      mapping.uid, item.itemType, item.identifier, item.containerClass, item.path,
                      err);
        return err;
    }
    QRN_LOG_INFO(LogCategory::Sandbox,
                 "Pushed user: {}, itemType: {}, identifier {}, class: {}, "
                 "persona id: {}, "
                 "path: {}",
                 mapping.uid, item.itemType, item.identifier, item.containerClass, item.personaID,
                 item.path);
    return 0;
}

int QRNContainerCache::pullSandboxMapping(const SandboxMapping& mapping) {
    const SandboxItem& item = mapping.item;
    const int err = sandbox_->removeContainerMapping(mapping.uid, item);
    // The goal is absence: a mapping that is not there is removed.
    if (err != 0 && err != ENOENT) {
        QRN_LOG_ERROR(LogCategory::Sandbox,
                      "Failed to remove mapping for user: {}, itemType: {}, identifier: {}, "
                      "class: {}, path: {} : {}",
                      mapping.uid, item.itemType, item.identifier, item.containerClass, item.path,
                      err);
        return err;
    }
    return 0;
}

int QRNContainerCache::setSandboxContainerMappingForUserIdentity(
    const QRNUserIdentityPtr& userIdentity, const std::string& identifier,
    std::uint64_t containerClass, const std::filesystem::path& url) {
    if (!userIdentity) {
        return EINVAL;
    }
    auto mapping = sandboxMappingFor(*userIdentity, identifier, containerClass, url.native());
    return mapping ? pushSandboxMapping(*mapping) : 0;
}

bool QRNContainerCache::shouldRegisterSandboxMappingWithUserIdentity(
    const QRNUserIdentityPtr& /*userIdentity*/, const std::string& /*identifier*/,
    std::uint64_t /*containerClass*/) const {
    return true;
}

QRNContainerCache::SandboxMapping QRNContainerCache::pushedMapping(const Slot& slot) {
    const QRNMetadata& pushed = *slot.pushed;
    SandboxMapping mapping;
    mapping.uid = slot.pushedUID;
    mapping.item.itemType = sandboxItemTypeForClass(pushed.containerClass());
    mapping.item.identifier = pushed.identifier();
    mapping.item.containerClass = pushed.containerClass();
    mapping.item.personaID = slot.pushedPersona;
    mapping.item.path = pushed.urlString();
    return mapping;
}

int QRNContainerCache::_lock_mapContainer(Slot& slot, const QRNUserIdentity& userIdentity) {
    _lock_assertOwned(__func__);
    const QRNMetadata& metadata = *slot.record;
    auto mapping = sandboxMappingFor(userIdentity, metadata.identifier(), metadata.containerClass(),
                                     metadata.urlString());
    if (!mapping) {
        return 0;
    }
    if (int err = pushSandboxMapping(*mapping); err != 0) {
        return err;
    }
    slot.pushed = slot.record;
    slot.pushedUID = mapping->uid;
    slot.pushedPersona = mapping->item.personaID;
    return 0;
}

void QRNContainerCache::_lock_populateSandbox(Entry& entry, const QRNUserIdentity& userIdentity) {
    _lock_assertOwned(__func__);
    for (auto& [identifier, slot] : entry.containers) {
        if (int err = _lock_mapContainer(slot, userIdentity); err != 0) {
            QRN_LOG_ERROR(LogCategory::Sandbox,
                          "Failed to set container mapping during create/lookup "
                          "operation of {}, "
                          "{}",
                          identifier, err);
        }
    }
    entry.sandboxPopulated = true;
}

void QRNContainerCache::_lock_unmapContainer(const Slot* slot, const QRNUserIdentity& userIdentity,
                                             std::uint64_t cls, const std::string& identifier) {
    _lock_assertOwned(__func__);
    std::optional<SandboxMapping> mapping;
    if (slot && slot->pushed) {
        mapping = pushedMapping(*slot);
    } else {
        // Not pushed by this entry (it was not built, or was dropped since):
        // the sandbox may still hold one from an earlier push; the path is no
        // part of what names a mapping.
        mapping = sandboxMappingFor(userIdentity, identifier, cls, {});
    }
    if (mapping) {
        if (int err = pullSandboxMapping(*mapping); err != 0) {
            QRN_LOG_ERROR(LogCategory::Sandbox, "Failed to remove container mapping of {}, {}",
                          identifier, err);
        }
    }
}

std::optional<SandboxItem>
QRNContainerCache::findKernelSandboxItem(std::uint32_t uid, const SandboxMapping& wanted) const {
    std::optional<SandboxItem> found;
    const int result = sandbox_->forEachItem(uid, [&](const SandboxItem& item) {
        if (item.identifier.empty() || item.path.empty()) {
            QRN_LOG_DEBUG(LogCategory::Sandbox,
                          "Skipping sandbox item of type {} without identifier or path",
                          item.itemType);
            return true;
        }
        if (item.itemType == wanted.item.itemType && item.identifier == wanted.item.identifier &&
            item.containerClass == wanted.item.containerClass &&
            item.personaID == wanted.item.personaID) {
            found = item;
            return false;
        }
        return true;
    });
    if (result != 0) {
        QRN_LOG_ERROR(LogCategory::Sandbox, "Failed to read back sandbox cache; result = {}",
                      result);
        return std::nullopt;
    }
    return found;
}

QRNContainerCache::MetadataPtr
QRNContainerCache::_lock_containerFromKernelSandbox(const QRNContainerIdentity& identity) {
    _lock_assertOwned(__func__);
    const auto& user = identity.userIdentity();
    const std::uint64_t cls = identity.containerClass();
    auto wanted = sandboxItemTypeForClass(cls) != 0
                      ? sandboxMappingFor(*user, identity.identifier(), cls, {})
                      : std::nullopt;
    if (!wanted) {
        return nullptr;
    }
    auto item = findKernelSandboxItem(wanted->uid, *wanted);
    if (!item) {
        return nullptr;
    }
    const std::filesystem::path url(item->path);
    QRN_LOG_INFO(LogCategory::Sandbox, "Container [{}] of class {} came from the sandbox cache: {}",
                 identity.identifier(), cls, url.string());
    auto metadata =
        QRNMetadata::readAndValidateMetadataAtFileUrl(url / QRNMetadata::kFileName, user, true);
    if (!metadata) {
        QRN_LOG_ERROR(LogCategory::Sandbox,
                      "Could not validate container from Sandbox-provided path "
                      "[{}]; error = {}",
                      url.string(), metadata.error());
        return nullptr;
    }
    const QRNMetadata& actual = **metadata;
    if (actual.containerClass() != cls || actual.identifier() != identity.identifier() ||
        !uuidMatches(identity, actual)) {
        QRN_LOG_ERROR(LogCategory::Sandbox,
                      "Attempted to fetch container from Sandbox-provided path "
                      "[{}] that was not "
                      "what was expected; expected class: {}, expected identifier: "
                      "[{}], actual "
                      "class: {}, actual identifier: [{}]",
                      url.string(), cls, identity.identifier(), actual.containerClass(),
                      actual.identifier());
        return nullptr;
    }
    return *metadata;
}

} // namespace quarn
