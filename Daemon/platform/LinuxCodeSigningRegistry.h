#pragma once
// CodeSigningRegistry over "<root>/etc/quarnd/codesign.d". A process is
// matched by the executable the kernel reports for it ("/proc/<pid>/exe" of
// the host, whatever the root prefix), which must be the very file at that
// path in the daemon's view, and, when the entry carries a digest, by the
// SHA-256 of that file. The directory is reread when it changes;
// the check is a non-blocking poll at each lookup. An entry's entitlements
// go only to the processes its holders admit (see EntitlementHolders).

#include "Daemon/platform/Accounts.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/platform/CodeSigningRegistryLoader.h"
#include "Daemon/platform/DirectoryChangeMonitor.h"
#include "Daemon/platform/ExecutableDigestCache.h"
#include "Daemon/platform/Paths.h"

#include <atomic>
#include <memory>
#include <mutex>

namespace quarn {

class LinuxCodeSigningRegistry final : public CodeSigningRegistry {
public:
    // `accounts` names the entries' entitled users and groups.
    LinuxCodeSigningRegistry(const Paths& paths, std::shared_ptr<const Accounts> accounts);

    std::optional<CodeSigningInfo> infoForAuditToken(const IpcPeer::AuditToken& token) override;
    // Bumped by every reread of the directory.
    std::uint64_t generation() override;
    std::uint64_t generationPolling(pollfd& other) override;

    const std::filesystem::path& directory() const { return directory_; }

private:
    using TablePtr = std::shared_ptr<const CodeSigningRegistryLoader::Table>;

    // Rereads the directory when it changed.
    void reloadIfChanged();
    // Rereads it if changes are still pending once the reload lock is held.
    void reload();
    // The current table, reread first when the directory changed.
    TablePtr currentTable();
    // `exe` is an open descriptor of the process's running executable.
    static bool isRegisteredFile(const CodeSigningRegistryEntry& entry, pid_t pid, int exe);
    // The entry's entitlements, or none when the process may not hold them.
    Value entitlementsFor(const CodeSigningRegistryEntry& entry, pid_t pid) const;
    bool digestMatches(const CodeSigningRegistryEntry& entry, pid_t pid, std::uint32_t startTime,
                       int exe);

    std::filesystem::path directory_;
    const std::shared_ptr<const Accounts> accounts_;
    ExecutableDigestCache digests_;

    // Serialises rereading: guards monitor_'s consumption and the reads of
    // the directory, so one change is read once.
    std::mutex reloadMutex_;
    DirectoryChangeMonitor monitor_;
    // Set once the first read is in table_; until then lookups wait for it.
    std::atomic<bool> loaded_{false};

    // Guards table_ (swapped by a reload, copied out by lookups) and the
    // writes of generation_.
    std::mutex tableMutex_;
    TablePtr table_;
    std::atomic<std::uint64_t> generation_{0}; // written with table_
};

} // namespace quarn
