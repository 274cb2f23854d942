#pragma once
// Sandbox extension tokens: a printable token that grants the process named
// by an audit token access of one extension class to one path. On Linux the
// token is an HMAC-SHA256 (see SandboxExtensionToken) under a per-boot key
// kept in "<run>/extension.key" (mode 0600), made on first use.

#include "Daemon/platform/IpcPeer.h"
#include "Daemon/support/QRNError.h"

#include <filesystem>
#include <string>
#include <string_view>

namespace quarn {

class SandboxExtensions {
public:
    static constexpr std::string_view kContainerClass = "com.orvex.sandbox.container";
    static constexpr std::string_view kApplicationGroupClass =
        "com.orvex.sandbox.application-group";

    virtual ~SandboxExtensions() = default;

    // A file extension for `path` (as the device sees it) issued to the
    // process of `token`. Fails with a POSIX error (errno) when no token can
    // be made.
    virtual Result<std::string> issueFileExtension(std::string_view extensionClass,
                                                   std::string_view path,
                                                   const IpcPeer::AuditToken& token) = 0;
};

} // namespace quarn
