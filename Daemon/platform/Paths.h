#pragma once
// Every fixed absolute path of the daemon is taken below the root prefix
// (`quarnd --root DIR`, default "/"). No other code joins an absolute path
// by hand: it asks Paths.

#include <filesystem>
#include <string>
#include <string_view>

namespace quarn {

class QRNDaemonContext;

class Paths {
public:
    explicit Paths(std::filesystem::path rootPrefix);
    explicit Paths(QRNDaemonContext& context);

    const std::filesystem::path& rootPrefix() const { return root_; }
    bool isSystemRoot() const { return root_ == "/"; }

    // "/private/var/containers" -> "<root>/private/var/containers". The
    // argument must be absolute; a relative one is taken from the root too.
    std::filesystem::path resolve(std::string_view absolutePath) const;

    // The path as the device would see it: the root prefix removed. Paths
    // outside the root come back unchanged.
    std::string devicePath(const std::filesystem::path& path) const;

    // "<root>/private/var/run/quarnd": sockets, lock state, notifications.
    std::filesystem::path runDirectory() const;
    // "<root>/etc/quarnd": code-signing registry, features, host flags.
    std::filesystem::path configDirectory() const;

private:
    std::filesystem::path root_;
};

} // namespace quarn
