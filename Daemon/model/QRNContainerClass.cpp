#include "Daemon/model/QRNContainerClass.h"

#include "Daemon/model/QRNPlatformConstants.h"

#include <array>

namespace quarn {

namespace {

constexpr std::array<std::string_view, 15> kRelativeDirectories = {"Undefined",
                                                                   "Bundle/Application",
                                                                   "Data/Application",
                                                                   "Bundle/MoorletPlugin",
                                                                   "Data/MoorletPlugin",
                                                                   "Bundle/VPNPlugin",
                                                                   "Data/VPNPlugin",
                                                                   "Shared/AppGroup",
                                                                   "Bundle/Framework",
                                                                   "Data/VellService",
                                                                   "Data/InternalDaemon",
                                                                   "Data/TempDir",
                                                                   "Data/System",
                                                                   "Shared/SystemGroup",
                                                                   "MAX"};

constexpr std::array<std::string_view, 15> kShortNames = {
    "",       "app",     "appData",    "plugin",      "pluginData",
    "vpn",    "vpnData", "appGroup",   "framework",   "vellService",
    "daemon", "tempDir", "systemData", "systemGroup", ""};

} // namespace

std::string_view QRNContainerClass::relativeDirectory(std::uint64_t cls) {
    return cls < kRelativeDirectories.size() ? kRelativeDirectories[cls] : std::string_view();
}

std::string_view QRNContainerClass::shortName(std::uint64_t cls) {
    return cls < kShortNames.size() ? kShortNames[cls] : std::string_view();
}

bool QRNContainerClass::isBundle(std::uint64_t cls) {
    return cls < 9 && ((std::uint64_t{0x12a} >> cls) & 1) != 0;
}

bool QRNContainerClass::isSystem(std::uint64_t cls) {
    return (cls | 1) == 13;
}

bool QRNContainerClass::isUserIdentityRequired(std::uint64_t cls) {
    return !isBundle(cls) && (cls | 1) != 13;
}

bool QRNContainerClass::isGroup(std::uint64_t cls) {
    return cls == kQRNContainerClassAppGroup || cls == kQRNContainerClassSystemGroup;
}

bool QRNContainerClass::usesPerUserStaging(std::uint64_t cls) {
    return cls < 12 && ((std::uint64_t{0xed4} >> cls) & 1) != 0;
}

QRNContainerClass::TransientBase QRNContainerClass::transientBase(std::uint64_t cls) {
    switch (cls) {
    case kQRNContainerClassAppBundle:
    case kQRNContainerClassPluginBundle:
    case kQRNContainerClassVPNBundle:
    case kQRNContainerClassFramework:
        return TransientBase::TransientBundle;
    case kQRNContainerClassAppData:
    case kQRNContainerClassPluginData:
    case kQRNContainerClassVPNData:
    case kQRNContainerClassAppGroup:
    case kQRNContainerClassSystemData:
    case kQRNContainerClassSystemGroup:
        return TransientBase::Transient;
    default:
        return TransientBase::None;
    }
}

std::uint32_t QRNContainerClass::baseDirectoryOwner(std::uint64_t cls) {
    return isBundle(cls) ? QRNPlatformConstants::kInstallationUID : 0;
}

} // namespace quarn
