#include "Daemon/platform/LinuxCodeSigningRegistry.h"

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/Log.h"

#include <fcntl.h>
#include <sodium.h>
#include <unistd.h>

#include <climits>

namespace quarn {

namespace {

// The host's /proc, not one below the root prefix: the peer is a process of
// this machine whatever root the daemon serves.
std::string procPath(pid_t pid, const char* entry) {
    return fmt::format("/proc/{}/{}", pid, entry);
}

std::optional<std::string> executablePath(pid_t pid) {
    std::string target(PATH_MAX, '\0');
    const ssize_t n = ::readlink(procPath(pid, "exe").c_str(), target.data(), target.size());
    if (n <= 0 || static_cast<std::size_t>(n) >= target.size()) {
        return std::nullopt;
    }
    target.resize(static_cast<std::size_t>(n));
    return target;
}

// The token's start time is the low 32 bits of the process's: another value
// means the pid now names another process.
bool isSameProcess(pid_t pid, std::uint32_t startTime) {
    const std::optional<std::uint64_t> now = IpcPeer::processStartTime(pid);
    return now && static_cast<std::uint32_t>(*now) == startTime;
}

} // namespace

LinuxCodeSigningRegistry::LinuxCodeSigningRegistry(const Paths& paths)
    : directory_(paths.configDirectory() / "codesign.d"), monitor_(directory_),
      table_(std::make_shared<const CodeSigningRegistryLoader::Table>()) {
    // The library wants this before any other call; repeating it is harmless.
    [[maybe_unused]] static const int sodiumReady = sodium_init();
}

LinuxCodeSigningRegistry::TablePtr LinuxCodeSigningRegistry::currentTable() {
    if (!loaded_.load() || monitor_.hasPendingChanges()) {
        std::lock_guard reload(reloadMutex_);
        // Consumed after the watch is (re)made and before the directory is
        // read, so a change during the read is seen by the next lookup.
        if (monitor_.consumeChanges()) {
            auto table = std::make_shared<const CodeSigningRegistryLoader::Table>(
                CodeSigningRegistryLoader::load(directory_, ::geteuid() == 0));
            std::lock_guard guard(tableMutex_);
            table_ = std::move(table);
        }
        loaded_.store(true);
    }
    std::lock_guard guard(tableMutex_);
    return table_;
}

bool LinuxCodeSigningRegistry::digestMatches(const CodeSigningRegistryEntry& entry, pid_t pid,
                                             std::uint32_t startTime) {
    // Through /proc/<pid>/exe, so the file hashed is the one running even
    // when another has since been put at its path.
    Descriptor exe(::open(procPath(pid, "exe").c_str(), O_RDONLY | O_CLOEXEC));
    const auto digest = exe.valid() ? digests_.digestOf(exe.get()) : std::nullopt;
    if (!digest || !isSameProcess(pid, startTime)) {
        QRN_LOG_ERROR(LogCategory::Vell, "Cannot hash the executable of pid {} ({})", pid,
                      entry.program);
        return false;
    }
    if (*digest != *entry.sha256) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "Executable {} of pid {} does not match the digest of code-signing entry {}",
                      entry.program, pid, entry.fileName);
        return false;
    }
    return true;
}

std::optional<CodeSigningInfo>
LinuxCodeSigningRegistry::infoForAuditToken(const IpcPeer::AuditToken& token) {
    const IpcPeer::TokenFields fields = IpcPeer::fieldsOfAuditToken(token);
    if (fields.pid == 0 || fields.pid > static_cast<std::uint32_t>(INT_MAX)) {
        return std::nullopt;
    }
    const auto pid = static_cast<pid_t>(fields.pid);
    if (!isSameProcess(pid, fields.startTime)) {
        return std::nullopt;
    }
    const std::optional<std::string> program = executablePath(pid);
    const TablePtr table = currentTable();
    const auto found = program ? table->find(*program) : table->end();
    if (found == table->end()) {
        return std::nullopt;
    }
    const CodeSigningRegistryEntry& entry = *found->second;
    if (entry.sha256 && !digestMatches(entry, pid, fields.startTime)) {
        return std::nullopt;
    }
    // The pid may have been reused between the first check and the readlink.
    if (!isSameProcess(pid, fields.startTime)) {
        return std::nullopt;
    }
    return entry.info;
}

} // namespace quarn
