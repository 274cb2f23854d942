#pragma once
// A throw-away root prefix for one test: its own etc/passwd and etc/group
// (user "mobile" 501/501 with home "/private/var/mobile", group
// "systemusers"), a fresh QRNDaemonContext made current on it, and removal of
// the whole tree afterwards.

#include "Daemon/support/QRNDaemonContext.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <memory>
#include <string>

namespace quarn::test {

inline constexpr unsigned kMobileUID = 501;
inline constexpr unsigned kSystemUsersGID = 1501;

class TempRoot {
public:
    struct Options {
        bool withMobileUser = true;
        bool installContext = true; // make a fresh current context on this root
    };
    TempRoot();
    explicit TempRoot(Options options);
    ~TempRoot();
    TempRoot(const TempRoot&) = delete;
    TempRoot& operator=(const TempRoot&) = delete;

    const std::filesystem::path& path() const { return root_; }
    // "<root>/private/var/mobile" style: the absolute path taken below the root.
    std::filesystem::path operator/(std::string_view absolute) const;
    QRNDaemonContext& context() { return *context_; }
    std::shared_ptr<QRNDaemonContext> sharedContext() { return context_; }

    // Writes a file below the root (parents made), replacing what is there.
    void writeFile(std::string_view absolute, std::string_view contents) const;

private:
    std::filesystem::path root_;
    std::shared_ptr<QRNDaemonContext> context_;
};

// Fixture base: a TempRoot per test.
class TempRootTest : public ::testing::Test {
protected:
    TempRoot root_;
};

} // namespace quarn::test
