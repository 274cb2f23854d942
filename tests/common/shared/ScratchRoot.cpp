#include "ScratchRoot.h"

#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LinuxPlatform.h"
#include "Daemon/platform/Paths.h"

#include <stdlib.h>

#include <fstream>
#include <stdexcept>

namespace quarn::test {

ScratchRoot::ScratchRoot() : ScratchRoot(Options{}) {}

ScratchRoot::ScratchRoot(Options options, std::string_view prefix,
                         const std::filesystem::path& base) {
    const auto parent = base.empty() ? std::filesystem::temp_directory_path() : base;
    std::string pattern = (parent / (std::string(prefix) + ".XXXXXX")).string();
    if (!::mkdtemp(pattern.data())) {
        throw std::runtime_error("cannot make a directory in " + parent.string());
    }
    root_ = pattern;
    std::string passwd = "root:x:0:0:root:/private/var/root:/bin/sh\n"
                         "_installd:x:33:33:installer:/private/var/installer:/bin/false\n";
    if (options.withMobileUser) {
        passwd += "mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh\n";
    }
    writeFile("/etc/passwd", passwd);
    writeFile("/etc/group", "wheel:x:0:\n"
                            "_installd:x:33:\n"
                            "mobile:x:501:\n"
                            "systemusers:x:1501:mobile\n");
    std::filesystem::create_directories(*this / "/private/var/mobile");
    if (options.installContext) {
        context_ = std::make_shared<QRNDaemonContext>(root_);
        installLinuxPlatform(*context_);
        QRNDaemonContext::setCurrent(context_);
    }
}

ScratchRoot::~ScratchRoot() {
    if (context_) {
        QRNDaemonContext::setCurrent(nullptr);
    }
    (void)FirstBootMarker(root_).remove();
    if (!keep_) {
        std::error_code ignored;
        std::filesystem::remove_all(root_, ignored);
    }
}

std::filesystem::path ScratchRoot::operator/(std::string_view absolute) const {
    return Paths(root_).resolve(absolute);
}

void ScratchRoot::writeFile(std::string_view absolute, std::string_view contents) const {
    const auto file = *this / absolute;
    std::filesystem::create_directories(file.parent_path());
    std::ofstream(file, std::ios::trunc) << contents;
}

} // namespace quarn::test
