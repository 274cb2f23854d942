#include "TempRoot.h"

#include "Daemon/platform/LinuxPlatform.h"
#include "Daemon/platform/Paths.h"

#include <fstream>
#include <stdexcept>
#include <stdlib.h>

namespace quarn::test {

TempRoot::TempRoot() : TempRoot(Options{}) {}

TempRoot::TempRoot(Options options) {
    std::string tmpl = (std::filesystem::temp_directory_path() / "quarn-test.XXXXXX").string();
    if (!mkdtemp(tmpl.data())) {
        throw std::runtime_error("mkdtemp failed");
    }
    root_ = tmpl;
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

TempRoot::~TempRoot() {
    if (context_) {
        QRNDaemonContext::setCurrent(nullptr);
    }
    std::error_code ec;
    std::filesystem::remove_all(root_, ec);
}

std::filesystem::path TempRoot::operator/(std::string_view absolute) const {
    return Paths(root_).resolve(absolute);
}

void TempRoot::writeFile(std::string_view absolute, std::string_view contents) const {
    auto p = *this / absolute;
    std::filesystem::create_directories(p.parent_path());
    std::ofstream out(p, std::ios::trunc);
    out << contents;
}

} // namespace quarn::test
