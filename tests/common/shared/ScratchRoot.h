#pragma once
// A throw-away root prefix: its own etc/passwd and etc/group (user "mobile"
// 501/501 with home "/private/var/mobile", group "systemusers" 1501, user and
// group "_installd" 33), optionally a fresh QRNDaemonContext made current on
// it. Removed, with its first-boot marker, when it goes.

#include "Daemon/support/QRNDaemonContext.h"

#include <filesystem>
#include <memory>
#include <string>
#include <string_view>

namespace quarn::test {

inline constexpr unsigned kMobileUID = 501;
inline constexpr unsigned kSystemUsersGID = 1501;

class ScratchRoot {
public:
    struct Options {
        bool withMobileUser = true;
        bool installContext = true; // make a fresh current context on this root
    };
    ScratchRoot();
    // In a new directory "<base>/<prefix>.XXXXXX" (base empty: the system's
    // temporary directory). Throws std::runtime_error when none can be made.
    explicit ScratchRoot(Options options, std::string_view prefix = "quarn-test",
                         const std::filesystem::path& base = {});
    ~ScratchRoot();
    ScratchRoot(const ScratchRoot&) = delete;
    ScratchRoot& operator=(const ScratchRoot&) = delete;

    const std::filesystem::path& path() const { return root_; }
    // "<root>/private/var/mobile" style: the absolute path taken below the root.
    std::filesystem::path operator/(std::string_view absolute) const;
    QRNDaemonContext& context() { return *context_; }
    std::shared_ptr<QRNDaemonContext> sharedContext() { return context_; }

    // Writes a file below the root (parents made), replacing what is there.
    void writeFile(std::string_view absolute, std::string_view contents) const;
    // Leaves the tree in place at the end.
    void keep() { keep_ = true; }

private:
    std::filesystem::path root_;
    std::shared_ptr<QRNDaemonContext> context_;
    bool keep_ = false;
};

} // namespace quarn::test
