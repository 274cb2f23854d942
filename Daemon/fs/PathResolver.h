#pragma once
// Opens paths below the root prefix without ever following a symbolic link
// there: users own parts of the layout and may swap any directory of theirs
// for a link at any moment. The root prefix itself and what lies above it
// are the administrator's, so links there are followed as usual.
//
// Below the root a path is resolved from a descriptor of the root prefix
// with openat2 (RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS):
// a link anywhere on the way, or a ".." leaving the root, fails with ELOOP
// or EXDEV, and the refusal is logged. Paths outside the root prefix are
// opened as given.

#include "Daemon/fs/EnvFd.h"

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>

namespace quarn {

class PathResolver {
public:
    // The resolve flags of every walk below the root prefix.
    static const std::uint64_t kBeneath;

    PathResolver(Env& env, std::filesystem::path rootPrefix);

    // Opens `url` with `flags` (O_CLOEXEC is added by the Env).
    SysResult<EnvFd> open(const std::filesystem::path& url, int flags, mode_t mode = 0) const;
    // The directory holding `url`, opened O_PATH, and the last name of `url`.
    struct Parent {
        EnvFd directory;
        std::string name;
    };
    SysResult<Parent> openParent(const std::filesystem::path& url) const;

    // `relative` below the open directory `dir` with the same restrictions;
    // `url` names the place in the log line of a refusal.
    SysResult<EnvFd> openBelow(const EnvFd& dir, const std::filesystem::path& url,
                               const std::string& relative, int flags, mode_t mode = 0) const;

    // Where a walk to `url` starts: the root prefix, opened, with the path
    // below it and kBeneath; or, for a path elsewhere, "/" (the working
    // directory for a relative one) with no restriction.
    struct Anchor {
        EnvFd start;
        std::string relative; // "" for the start itself
        std::uint64_t resolve = 0;
    };
    SysResult<Anchor> anchor(const std::filesystem::path& url) const;

    // The part of `url` below the root prefix ("" for the root itself), or
    // nothing when `url` does not lie below it.
    std::optional<std::string> relativeToRoot(const std::filesystem::path& url) const;

    // Logs a refused link (ELOOP) or escape (EXDEV) at `url`; other errors
    // are left to the caller.
    static void logRefusal(const std::filesystem::path& url, int err);

private:
    Env& env_;
    std::string root_;     // without a trailing separator; "" for "/"
    std::string realRoot_; // the same after the links above it are resolved
};

} // namespace quarn
