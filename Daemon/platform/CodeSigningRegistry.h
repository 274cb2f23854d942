#pragma once
// The code-signing identity of a process: which identifier, entitlements and
// sandbox state its executable was registered with. On Linux the registry is
// the root-owned directory "<root>/etc/quarnd/codesign.d" of property lists
// with the keys "Program" (absolute path of the executable as the kernel
// reports it), "SHA256" (optional hex digest of it), "Identifier",
// "Entitlements" (dictionary), "EntitledUsers" and "EntitledGroups" (who may
// hold them; root only without either) and "Sandboxed" (boolean).

#include "Daemon/platform/IpcPeer.h"
#include "Daemon/support/Value.h"

#include <poll.h>

#include <cstdint>
#include <optional>
#include <string>

namespace quarn {

struct CodeSigningInfo {
    std::string identifier;
    // None when the entry has no "Entitlements"; an empty dictionary when
    // they are no dictionary or the process may not hold them.
    std::optional<Value> entitlements;
    bool sandboxed = false;
};

class CodeSigningRegistry {
public:
    virtual ~CodeSigningRegistry() = default;

    // The entry of the process behind the token. None when the process has
    // gone (or its pid now names another process: the start time differs),
    // when its executable matches no entry, or when the entry's digest does
    // not match the executable.
    virtual std::optional<CodeSigningInfo> infoForAuditToken(const IpcPeer::AuditToken& token) = 0;

    // A number that changes whenever the registry's answers may have
    // changed, rereading the registry first when it changed; answers
    // computed under one generation hold until it changes. Cheap enough to
    // ask on every request. A registry that never changes keeps 0.
    virtual std::uint64_t generation() { return 0; }
    // generation(), polling `other` (whose revents are set) on the way:
    // one system call instead of two where the registry polls for changes.
    virtual std::uint64_t generationPolling(pollfd& other) {
        ::poll(&other, 1, 0);
        return generation();
    }
};

} // namespace quarn
