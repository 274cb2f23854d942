#pragma once
// Checks a sandbox extension token from a reply against the key of the
// daemon that issued it: "<run>/extension.key" below the daemon's root
// prefix. The key file is readable by root only, so only privileged callers
// can check.

#include "Daemon/support/QRNError.h"

#include <filesystem>
#include <string_view>

namespace quarn {

class QRNSandboxTokenVerifier {
public:
    // True when the token is well-formed and was signed with the daemon's
    // current key. A POSIX error when the key file cannot be read (ENOENT
    // until the daemon has issued its first token) or is not a key.
    static Result<bool> verifySandboxToken(std::string_view token,
                                           const std::filesystem::path& rootPrefix);
};

} // namespace quarn
