#include "LoadRoot.h"

#include "Fail.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/PropertyList.h"

#include <cstdio>
#include <fstream>
#include <stdexcept>

namespace quarn::loadbench {

namespace {

test::ScratchRoot makeRoot(const std::filesystem::path& base) {
    try {
        return test::ScratchRoot(test::ScratchRoot::Options{}, "quarn-bench", base);
    } catch (const std::runtime_error& error) {
        fail("{}", error.what());
    }
}

} // namespace

LoadRoot::LoadRoot(const std::filesystem::path& base, bool keep)
    : root_(makeRoot(base)), keep_(keep) {
    // The daemon's working directories are made below it.
    std::filesystem::permissions(path(), std::filesystem::perms(0755));
    root_.writeFile("/etc/os-release",
                    "ID=orvex\nVERSION_ID=1.0\nBUILD_ID=bench\nVARIANT_ID=user\n");
    writeRegistryEntry();
}

LoadRoot::~LoadRoot() {
    if (keep_) {
        std::printf("quarn-bench: root kept at %s\n", path().c_str());
        root_.keep();
        return;
    }
    // Through the file manager: it removes a 100k-container tree fastest.
    (void)QRNFileManager::defaultManager().removeItemAtURL(path());
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
    const auto directory = Paths(path()).configDirectory() / "codesign.d";
    std::filesystem::create_directories(directory);
    if (!QRN_writeToURL(entry, directory / "quarn-bench.plist")) {
        fail("cannot write the code-signing registry entry in {}", directory.string());
    }
}

std::filesystem::path LoadRoot::socketPath() const {
    return Paths(path()).runDirectory() / "com.orvex.quarnd.sock";
}

std::size_t LoadRoot::notificationCount(const char* name) const {
    std::ifstream file(Paths(path()).runDirectory() / "notifications" / name);
    std::size_t lines = 0;
    for (std::string line; std::getline(file, line);) {
        ++lines;
    }
    return lines;
}

} // namespace quarn::loadbench
