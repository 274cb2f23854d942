#include "Daemon/fs/PathResolver.h"

#include "Daemon/support/Log.h"

#include <linux/openat2.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

std::string withoutTrailingSeparators(std::string text) {
    while (!text.empty() && text.back() == '/') {
        text.pop_back();
    }
    return text;
}

// The rest of `path` below `root`, or nothing when it lies elsewhere.
std::optional<std::string> below(const std::string& path, const std::string& root) {
    if (path.compare(0, root.size(), root) != 0) {
        return std::nullopt;
    }
    if (path.size() == root.size()) {
        return std::string();
    }
    if (path[root.size()] != '/') {
        return std::nullopt; // "/rootx" is not below "/root"
    }
    std::size_t start = root.size();
    while (start < path.size() && path[start] == '/') {
        ++start;
    }
    return withoutTrailingSeparators(path.substr(start));
}

// With the links refused by the walk itself, a link as the last name fails
// with ELOOP too; O_NOFOLLOW would turn that into ENOTDIR for a directory
// open. Kept for O_PATH, where it opens the link itself.
int walkFlags(int flags, std::uint64_t resolve) {
    const bool refusesLinks = (resolve & RESOLVE_NO_SYMLINKS) != 0;
    return refusesLinks && (flags & O_PATH) == 0 ? flags & ~O_NOFOLLOW : flags;
}

} // namespace

const std::uint64_t PathResolver::kBeneath =
    RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS;

PathResolver::PathResolver(Env& env, std::filesystem::path rootPrefix)
    : env_(env), root_(withoutTrailingSeparators(rootPrefix.string())) {
    auto real = env_.realpath(root_.empty() ? "/" : root_.c_str());
    realRoot_ = real ? withoutTrailingSeparators(*real) : root_;
}

std::optional<std::string> PathResolver::relativeToRoot(const std::filesystem::path& url) const {
    if (!url.is_absolute()) {
        return std::nullopt;
    }
    if (auto rest = below(url.string(), root_)) {
        return rest;
    }
    return below(url.string(), realRoot_);
}

void PathResolver::logRefusal(const std::filesystem::path& url, int err) {
    if (err == ELOOP) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "Refusing {}: a symbolic link stands where the layout has a directory",
                      url.string());
    } else if (err == EXDEV) {
        QRN_LOG_ERROR(LogCategory::Fs, "Refusing {}: it leads outside the root prefix",
                      url.string());
    }
}

SysResult<PathResolver::Anchor> PathResolver::anchor(const std::filesystem::path& url) const {
    const auto relative = relativeToRoot(url);
    const char* start =
        relative ? (root_.empty() ? "/" : root_.c_str()) : (url.is_absolute() ? "/" : ".");
    auto opened = env_.openat(AT_FDCWD, start, O_PATH | O_DIRECTORY);
    if (!opened) {
        return SysError(opened.error());
    }
    if (relative) {
        return Anchor{EnvFd(env_, *opened), *relative, kBeneath};
    }
    return Anchor{EnvFd(env_, *opened), withoutTrailingSeparators(url.relative_path().string()), 0};
}

SysResult<EnvFd> PathResolver::open(const std::filesystem::path& url, int flags,
                                    mode_t mode) const {
    auto from = anchor(url);
    if (!from) {
        return SysError(from.error());
    }
    const std::string& relative = from->relative.empty() ? std::string(".") : from->relative;
    auto opened = env_.openat2(from->start.get(), relative.c_str(), walkFlags(flags, from->resolve),
                               mode, from->resolve);
    if (!opened) {
        logRefusal(url, opened.error());
        return SysError(opened.error());
    }
    return EnvFd(env_, *opened);
}

SysResult<EnvFd> PathResolver::openBelow(const EnvFd& dir, const std::filesystem::path& url,
                                         const std::string& relative, int flags,
                                         mode_t mode) const {
    auto opened =
        env_.openat2(dir.get(), relative.c_str(), walkFlags(flags, kBeneath), mode, kBeneath);
    if (!opened) {
        logRefusal(url, opened.error());
        return SysError(opened.error());
    }
    return EnvFd(env_, *opened);
}

SysResult<PathResolver::Parent> PathResolver::openParent(const std::filesystem::path& url) const {
    const std::string text = withoutTrailingSeparators(url.string());
    const std::filesystem::path trimmed(text);
    std::string name = trimmed.filename().string();
    if (name.empty() || name == "." || name == "..") {
        return SysError(EINVAL);
    }
    std::filesystem::path parent = trimmed.parent_path();
    if (parent.empty()) {
        parent = ".";
    }
    auto opened = open(parent, O_PATH | O_DIRECTORY);
    if (!opened) {
        return SysError(opened.error());
    }
    return Parent{std::move(*opened), std::move(name)};
}

} // namespace quarn
