// The containment check: does a client-supplied path really lie inside a
// container?
//
// "/private": on the device /var, /tmp and /etc are links into /private, so
// the string checks treat "<root>/private/var/x" and "<root>/var/x" alike
// (the rule is applied to the path as the device sees it, below the root
// prefix). On Linux the two are not the same place, so the file system is
// always asked with the paths as given; the final comparison is on real
// paths, where a link "<root>/var" -> "private/var" makes the two forms meet.

#include "Daemon/fs/QRNFileManager.h"

#include "Daemon/fs/Env.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

namespace fs = std::filesystem;

// Readlink and realpath answer into buffers of this size; longer results
// are refused rather than cut.
constexpr std::size_t kPathBufferSize = 1024;
constexpr std::string_view kPrivate = "/private";

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

// The "/private" rule on the device's view of `path`.
std::string withoutPrivatePrefix(const fs::path& rootPrefix, const std::string& path) {
    const std::string root = rootPrefix == "/" ? std::string() : rootPrefix.string();
    if (startsWith(path, root + std::string(kPrivate) + "/")) {
        return root + path.substr(root.size() + kPrivate.size());
    }
    return path;
}

// Components between slashes, empty ones left out.
std::vector<std::string> namesOf(std::string_view path) {
    std::vector<std::string> names;
    while (!path.empty()) {
        auto slash = path.find('/');
        auto name = path.substr(0, slash);
        if (!name.empty()) {
            names.emplace_back(name);
        }
        if (slash == std::string_view::npos) {
            break;
        }
        path.remove_prefix(slash + 1);
    }
    return names;
}

// Components as the comparison counts them: "/" first for an absolute path.
std::vector<std::string> componentsOf(const fs::path& path) {
    std::vector<std::string> components;
    if (path.is_absolute()) {
        components.emplace_back("/");
    }
    for (auto& name : namesOf(path.string())) {
        components.push_back(std::move(name));
    }
    return components;
}

bool hasDotDotComponent(std::string_view path) {
    for (const auto& name : namesOf(path)) {
        if (name == "..") {
            return true;
        }
    }
    return false;
}

enum class LinkCheck { NotALink, Link, Rejected };

// Step 5: a link is accepted only with a relative target that stays below
// the base. Reads the link with the path as given (see the file comment).
LinkCheck checkLink(QRNFileManager& manager, const fs::path& suspiciousURL,
                    const std::string& suspicious, const std::string& base) {
    auto target = manager.env().readlinkat(AT_FDCWD, suspiciousURL.c_str(), kPathBufferSize);
    if (target && target->size() >= kPathBufferSize) {
        target = SysError(ENAMETOOLONG);
    }
    if (!target) {
        if (target.error() == EINVAL || target.error() == ENOENT) {
            return LinkCheck::NotALink;
        }
        QRN_LOG_ERROR(LogCategory::Fs, "Readlink failed: {}", std::strerror(target.error()));
        return LinkCheck::Rejected;
    }
    if (startsWith(*target, "/")) {
        QRN_LOG_ERROR(LogCategory::Fs, "Rejecting {} -> {}, as absolute symlinks are not allowed",
                      suspiciousURL.string(), *target);
        return LinkCheck::Rejected;
    }
    auto baseDepth = manager._validateSymlink(base, 0);
    if (!baseDepth) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to retrieve depth of {}", base);
        return LinkCheck::Rejected;
    }
    // The link's directory relative to the base, then its target.
    const fs::path below(suspicious.substr(base.size()));
    const std::string walked = (below.parent_path() / *target).string();
    if (!manager._validateSymlink(walked, *baseDepth)) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "Rejecting {} -> {}, as it is points outside or to the base {}",
                      suspiciousURL.string(), *target, base);
        return LinkCheck::Rejected;
    }
    return LinkCheck::Link;
}

// Step 7: the base's components must start the suspicious path's.
bool componentsAgree(const fs::path& suspiciousURL, const fs::path& baseURL,
                     const fs::path& realSuspicious, const fs::path& realBase) {
    const auto child = componentsOf(realSuspicious);
    const auto parent = componentsOf(realBase);
    const auto reals = fmt::format("(reals {} ; {})", realSuspicious.string(), realBase.string());
    if (child.size() < 2 || parent.size() < 2) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "Rejecting {} with base {} because real component counts don't make sense {}",
                      suspiciousURL.string(), baseURL.string(), reals);
        return false;
    }
    // "/private/var" and "/var" compare alike.
    const std::size_t childStart = child[1] == "private" ? 2 : 1;
    const std::size_t parentStart = parent[1] == "private" ? 2 : 1;
    if (parent.size() - parentStart > child.size() - childStart) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "Rejecting {} with base {} because base component count is greater than "
                      "child component count {}",
                      suspiciousURL.string(), baseURL.string(), reals);
        return false;
    }
    for (std::size_t i = 0; parentStart + i < parent.size(); ++i) {
        const auto& mine = parent[parentStart + i];
        const auto& theirs = child[childStart + i];
        if (mine != theirs) {
            QRN_LOG_ERROR(LogCategory::Fs,
                          "Rejecting {} with base {} {} because components diverge at {} != {}",
                          suspiciousURL.string(), baseURL.string(), reals, mine, theirs);
            return false;
        }
    }
    return true;
}

} // namespace

std::optional<fs::path> QRNFileManager::realPathForURL(const fs::path& suspiciousURL,
                                                       const fs::path& baseURL) {
    if (suspiciousURL.empty() || baseURL.empty()) {
        QRN_LOG_ERROR(LogCategory::Fs, "The base path {} and/or suspicious path {} were nil",
                      baseURL.string(), suspiciousURL.string());
        return std::nullopt;
    }
    const auto& root = context_->instance<Paths>().rootPrefix();
    const std::string suspicious = withoutPrivatePrefix(root, suspiciousURL.string());
    const std::string base = withoutPrivatePrefix(root, baseURL.string());
    if (!startsWith(suspicious, base)) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "supiscious path {} does not contain base path {} as a prefix", suspicious,
                      base);
        return std::nullopt;
    }
    // Before anything touches the file system.
    if (hasDotDotComponent(suspicious)) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "The suspicious path {} contains '..' paths, which are invalid", suspicious);
        return std::nullopt;
    }
    if (checkLink(*this, suspiciousURL, suspicious, base) == LinkCheck::Rejected) {
        return std::nullopt;
    }
    auto realBase = _realPathForURL(baseURL, false);
    if (!realBase) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to retrieve realpath for base path {} ", base);
        return std::nullopt;
    }
    auto realSuspicious = _realPathForURL(suspiciousURL, true);
    if (!realSuspicious) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to retrieve realpath for suspicious path {}",
                      suspicious);
        return std::nullopt;
    }
    // A link that passed its depth check is compared as well: the check sees
    // only the first hop of a chain, not links further on or in its parents.
    if (!componentsAgree(suspiciousURL, baseURL, *realSuspicious, *realBase)) {
        return std::nullopt;
    }
    return realSuspicious;
}

std::optional<int> QRNFileManager::_validateSymlink(std::string_view path, int startingDepth) {
    int depth = startingDepth;
    for (const auto& name : namesOf(path)) {
        if (name == "..") {
            --depth;
        } else if (name != ".") {
            ++depth;
        }
        if (depth < startingDepth) {
            return std::nullopt;
        }
    }
    return depth;
}

std::optional<fs::path> QRNFileManager::_realPathForURL(const fs::path& url,
                                                        bool allowNonExistentPathComponents) {
    auto real = env_->realpath(url.c_str());
    if (real && real->size() >= kPathBufferSize) {
        real = SysError(ENAMETOOLONG);
    }
    if (real) {
        return fs::path(*real);
    }
    if (real.error() == ENOENT && allowNonExistentPathComponents) {
        return _realPathWhatExistsInPath(url);
    }
    QRN_LOG_ERROR(LogCategory::Fs, "Failed to realpath {} : {} at {}", url.string(),
                  std::strerror(real.error()), __func__);
    return std::nullopt;
}

std::optional<fs::path> QRNFileManager::_realPathWhatExistsInPath(const fs::path& url) {
    const std::vector<fs::path> parts(url.begin(), url.end());
    // Never the root alone.
    const std::size_t shortest = url.has_root_directory() ? 2 : 1;
    for (std::size_t length = parts.size(); length >= shortest; --length) {
        fs::path prefix;
        for (std::size_t i = 0; i < length; ++i) {
            prefix /= parts[i];
        }
        if (!itemExistsAtURL(prefix)) {
            continue;
        }
        // The longest existing prefix must resolve: one that exists and does
        // not is a dangling link, and the missing names below it would later
        // be created wherever it points.
        auto real = env_->realpath(prefix.c_str());
        if (!real || real->size() >= kPathBufferSize) {
            return std::nullopt;
        }
        fs::path result(*real);
        std::vector<std::string> missing;
        for (std::size_t i = length; i < parts.size(); ++i) {
            result /= parts[i];
            missing.push_back(parts[i].string());
        }
        QRN_LOG_DEBUG(LogCategory::Fs, "Realpathed {} ; appending non-existing components {}",
                      *real, missing);
        return result;
    }
    return std::nullopt;
}

} // namespace quarn
