#include "LoadRoot.h"

#include "Fail.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LinuxPlatform.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/PropertyList.h"

#include <stdlib.h>

#include <cstdio>
#include <fstream>

namespace quarn::loadbench {

namespace {

void writeFile(const std::filesystem::path& path, const char* contents) {
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path, std::ios::trunc) << contents;
}

} // namespace

LoadRoot::LoadRoot(const std::filesystem::path& base, bool keep) : keep_(keep) {
    std::string tmpl = (base / "quarn-bench.XXXXXX").string();
    if (!mkdtemp(tmpl.data())) {
        fail("cannot make a directory in {}", base.string());
    }
    root_ = tmpl;
    // The daemon's working directories are made below it.
    std::filesystem::permissions(root_, std::filesystem::perms(0755));
    writeAccounts();
    writeRegistryEntry();
    context_ = std::make_shared<QRNDaemonContext>(root_);
    installLinuxPlatform(*context_);
    QRNDaemonContext::setCurrent(context_);
}

LoadRoot::~LoadRoot() {
    (void)FirstBootMarker(root_).remove();
    if (keep_) {
        std::printf("quarn-bench: root kept at %s\n", root_.c_str());
        QRNDaemonContext::setCurrent(nullptr);
        return;
    }
    // Through the file manager: it removes a 100k-container tree fastest.
    (void)QRNFileManager::defaultManager().removeItemAtURL(root_);
    QRNDaemonContext::setCurrent(nullptr);
}

void LoadRoot::writeAccounts() const {
    const Paths paths(root_);
    writeFile(paths.resolve("/etc/passwd"),
              "root:x:0:0:root:/private/var/root:/bin/sh\n"
              "_installd:x:33:33:installer:/private/var/installer:/bin/false\n"
              "mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh\n");
    writeFile(paths.resolve("/etc/group"), "wheel:x:0:\n"
                                           "_installd:x:33:\n"
                                           "mobile:x:501:\n"
                                           "systemusers:x:1501:mobile\n");
    writeFile(paths.resolve("/etc/os-release"),
              "ID=orvex\nVERSION_ID=1.0\nBUILD_ID=bench\nVARIANT_ID=user\n");
    std::filesystem::create_directories(paths.resolve("/private/var/mobile"));
}

// The daemon knows a client by the executable the kernel reports for it:
// this tool's own.
void LoadRoot::writeRegistryEntry() const {
    const auto program = std::filesystem::read_symlink("/proc/self/exe");
    const Value entry(Value::Dictionary{
        {"Program", Value(program.string())},
        {"Identifier", Value("com.orvex.quarn-bench")},
        {"Entitlements",
         Value(Value::Dictionary{{"com.orvex.private.Quarn.allowed", Value(true)}})}});
    const auto directory = Paths(root_).configDirectory() / "codesign.d";
    std::filesystem::create_directories(directory);
    if (!QRN_writeToURL(entry, directory / "quarn-bench.plist")) {
        fail("cannot write the code-signing registry entry in {}", directory.string());
    }
}

std::filesystem::path LoadRoot::socketPath() const {
    return Paths(root_).runDirectory() / "com.orvex.quarnd.sock";
}

std::size_t LoadRoot::notificationCount(const char* name) const {
    std::ifstream file(Paths(root_).runDirectory() / "notifications" / name);
    std::size_t lines = 0;
    for (std::string line; std::getline(file, line);) {
        ++lines;
    }
    return lines;
}

} // namespace quarn::loadbench
