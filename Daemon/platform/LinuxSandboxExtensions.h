#pragma once
// SandboxExtensions with tokens signed under a per-boot key kept in
// "<run>/extension.key" (32 random bytes, mode 0600). The run directory
// lives as long as the boot, so a client library can check a token against
// the running daemon's key file; the key is made on the first issue and
// kept in memory after.

#include "Daemon/platform/Paths.h"
#include "Daemon/platform/SandboxExtensionToken.h"
#include "Daemon/platform/SandboxExtensions.h"

#include <filesystem>
#include <mutex>
#include <optional>

namespace quarn {

class LinuxSandboxExtensions final : public SandboxExtensions {
public:
    static constexpr const char* kKeyFileName = "extension.key";

    explicit LinuxSandboxExtensions(const Paths& paths);

    Result<std::string> issueFileExtension(std::string_view extensionClass, std::string_view path,
                                           const IpcPeer::AuditToken& token) override;

    // The key tokens are signed with: the one in memory, else the key file's,
    // else a new one written to the key file.
    Result<SandboxExtensionToken::Key> key();

private:
    Result<SandboxExtensionToken::Key> loadOrCreateKey() const;
    Result<SandboxExtensionToken::Key> publishNewKey(bool replace) const;

    std::filesystem::path keyFile_;
    // Guards key_, and makes one thread at a time read or write the key file.
    std::mutex mutex_;
    std::optional<SandboxExtensionToken::Key> key_;
};

} // namespace quarn
