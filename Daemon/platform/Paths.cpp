#include "Daemon/platform/Paths.h"

#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

static std::filesystem::path normalizedRoot(std::filesystem::path root) {
    if (root.empty()) {
        return "/";
    }
    auto s = root.lexically_normal().string();
    while (s.size() > 1 && s.back() == '/') {
        s.pop_back();
    }
    return s;
}

Paths::Paths(std::filesystem::path rootPrefix) : root_(normalizedRoot(std::move(rootPrefix))) {}

Paths::Paths(QRNDaemonContext& context) : Paths(context.rootPrefix()) {}

std::filesystem::path Paths::resolve(std::string_view absolutePath) const {
    while (!absolutePath.empty() && absolutePath.front() == '/') {
        absolutePath.remove_prefix(1);
    }
    if (absolutePath.empty()) {
        return root_;
    }
    return root_ / std::filesystem::path(absolutePath);
}

std::string Paths::devicePath(const std::filesystem::path& path) const {
    if (isSystemRoot()) {
        return path.string();
    }
    const std::string r = root_.string();
    const std::string p = path.string();
    if (p == r) {
        return "/";
    }
    if (p.size() > r.size() && p.compare(0, r.size(), r) == 0 && p[r.size()] == '/') {
        return p.substr(r.size());
    }
    return p;
}

std::filesystem::path Paths::runDirectory() const {
    return resolve("/private/var/run/quarnd");
}

std::filesystem::path Paths::configDirectory() const {
    return resolve("/etc/quarnd");
}

} // namespace quarn
