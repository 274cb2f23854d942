#include "Daemon/platform/LinuxCodeSigningRegistry.h"

#include "Daemon/platform/ProcessInfo.h"
#include "Daemon/support/Descriptor.h"
#include "Daemon/support/Log.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstring>

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

Expected<EntitlementHolders::Process, int> processOf(pid_t pid) {
    auto process = ProcessInfo::open(pid);
    if (!process) {
        return Unexpected<int>(process.error());
    }
    auto standing = process->standing();
    if (!standing) {
        return Unexpected<int>(standing.error());
    }
    auto injection = process->loaderInjection();
    if (!injection) {
        return Unexpected<int>(injection.error());
    }
    return EntitlementHolders::Process{std::move(*standing), std::move(*injection)};
}

} // namespace

LinuxCodeSigningRegistry::LinuxCodeSigningRegistry(const Paths& paths,
                                                   std::shared_ptr<const Accounts> accounts)
    : directory_(paths.configDirectory() / "codesign.d"), accounts_(std::move(accounts)),
      monitor_(directory_), table_(std::make_shared<const CodeSigningRegistryLoader::Table>()) {
    // The library wants this before any other call; repeating it is harmless.
    [[maybe_unused]] static const int sodiumReady = sodium_init();
}

void LinuxCodeSigningRegistry::reloadIfChanged() {
    if (!loaded_.load() || monitor_.hasPendingChanges()) {
        reload();
    }
}

std::uint64_t LinuxCodeSigningRegistry::generationPolling(pollfd& other) {
    const bool changed = monitor_.hasPendingChangesPolling(other);
    if (!loaded_.load() || changed) {
        reload();
    }
    return generation_.load();
}

void LinuxCodeSigningRegistry::reload() {
    std::lock_guard serialised(reloadMutex_);
    // Consumed after the watch is (re)made and before the directory is
    // read, so a change during the read is seen by the next lookup.
    if (monitor_.consumeChanges()) {
        auto table = std::make_shared<const CodeSigningRegistryLoader::Table>(
            CodeSigningRegistryLoader::load(directory_, ::geteuid() == 0));
        std::lock_guard guard(tableMutex_);
        table_ = std::move(table);
        generation_.fetch_add(1);
    }
    loaded_.store(true);
}

LinuxCodeSigningRegistry::TablePtr LinuxCodeSigningRegistry::currentTable() {
    reloadIfChanged();
    std::lock_guard guard(tableMutex_);
    return table_;
}

std::uint64_t LinuxCodeSigningRegistry::generation() {
    // Rereads first, so a change made before this call is counted.
    reloadIfChanged();
    return generation_.load();
}

// The path the kernel reports for a process is the one in the process's own
// mount namespace: an unprivileged user may bind another file over a
// registered program there. The running file must be the very file at that
// path here.
bool LinuxCodeSigningRegistry::isRegisteredFile(const CodeSigningRegistryEntry& entry, pid_t pid,
                                                int exe) {
    struct stat running {};
    struct stat registered {};
    if (::fstat(exe, &running) != 0 || ::stat(entry.program.c_str(), &registered) != 0 ||
        running.st_dev != registered.st_dev || running.st_ino != registered.st_ino) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "The executable of pid {} is not the file {} of code-signing entry {}", pid,
                      entry.program, entry.fileName);
        return false;
    }
    return true;
}

bool LinuxCodeSigningRegistry::digestMatches(const CodeSigningRegistryEntry& entry, pid_t pid,
                                             std::uint32_t startTime, int exe) {
    const auto digest = digests_.digestOf(exe);
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

// Read only for entries that grant something: most clients are apps
// without entitlements, and /proc reads are the dearest part of identifying one.
Value LinuxCodeSigningRegistry::entitlementsFor(const CodeSigningRegistryEntry& entry,
                                                pid_t pid) const {
    const std::optional<Value>& granted = entry.info.entitlements;
    if (!granted || granted->size() == 0) {
        return granted ? *granted : Value();
    }
    std::string why;
    if (auto process = processOf(pid); !process) {
        why = fmt::format("its /proc entries cannot be read ({})", std::strerror(process.error()));
    } else if (auto refused = entry.holders.refusal(*process, *accounts_)) {
        why = std::move(*refused);
    } else {
        return *granted;
    }
    QRN_LOG_NOTICE(LogCategory::Vell,
                   "pid {} runs {} of code-signing entry {} without its "
                   "entitlements: {}",
                   pid, entry.program, entry.fileName, why);
    return Value::dictionary();
}

std::optional<CodeSigningInfo>
LinuxCodeSigningRegistry::infoForAuditToken(const IpcPeer::AuditToken& token) {
    const IpcPeer::TokenFields fields = IpcPeer::fieldsOfAuditToken(token);
    if (fields.pid == 0 || fields.pid > static_cast<std::uint32_t>(INT_MAX)) {
        return std::nullopt;
    }
    const auto pid = static_cast<pid_t>(fields.pid);
    const std::optional<std::string> program = executablePath(pid);
    const TablePtr table = currentTable();
    const auto found = program ? table->find(*program) : table->end();
    if (found == table->end()) {
        return std::nullopt;
    }
    const CodeSigningRegistryEntry& entry = *found->second;
    // Through /proc/<pid>/exe, so the file checked is the one running even
    // when another has since been put at its path.
    Descriptor exe(::open(procPath(pid, "exe").c_str(), O_RDONLY | O_CLOEXEC));
    if (!exe.valid() || !isRegisteredFile(entry, pid, exe.get())) {
        return std::nullopt;
    }
    if (entry.sha256 && !digestMatches(entry, pid, fields.startTime, exe.get())) {
        return std::nullopt;
    }
    // Checked once, after the readlink: a process whose pid and start time
    // still match now is the one whose executable was read, since a pid is
    // never given back to a process that has ended. (Each check reads
    // /proc/<pid>/stat, the dearest step of a request.)
    CodeSigningInfo info = entry.info;
    if (info.entitlements) {
        info.entitlements = entitlementsFor(entry, pid);
    }
    if (!isSameProcess(pid, fields.startTime)) {
        return std::nullopt;
    }
    return info;
}

} // namespace quarn
