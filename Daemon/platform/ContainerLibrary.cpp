#include "Daemon/platform/ContainerLibrary.h"

namespace quarn {

CodeResult<std::vector<std::string>>
LinuxContainerLibrary::subdirectoryNamesForClass(std::uint64_t containerClass) const {
    switch (containerClass) {
    case 1:
    case 3:
    case 5:
    case 8:
        return std::vector<std::string>{};
    case 2:
    case 4:
    case 6:
        return std::vector<std::string>{"Documents",           "Library",    "Library/Caches",
                                        "Library/Preferences", "SystemData", "tmp"};
    case 7:
    case 12:
    case 13:
        return std::vector<std::string>{"Library", "Library/Caches", "Library/Preferences"};
    case 9:
    case 10:
        return std::vector<std::string>{"Library", "Library/Caches", "Library/Preferences", "tmp"};
    case 11:
        return std::vector<std::string>{"tmp"};
    default:
        QRN_LOG_ERROR(LogCategory::Unspecified, "Passed an unexpected container type: {}",
                      containerClass);
        return QRN_CODE(kQRNErrorUnexpectedContainerType);
    }
}

} // namespace quarn
