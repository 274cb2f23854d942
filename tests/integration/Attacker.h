#pragma once
// The unprivileged local user of the hostile-client tests: steps run in a
// forked child as uid/gid 501 ("mobile" of the test root) without
// supplementary groups, and a record of a tree's owners and modes to show
// that nothing outside a container changed.

#include "Client/QRNClientRequests.h"
#include "DaemonHarness.h"

#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <grp.h>
#include <map>
#include <string>
#include <tuple>

namespace quarn::test {

inline constexpr uid_t kAttackerUID = 501;

// Runs `steps` in a child as `uid` (gid the same); true when they answered
// true there. The child leaves with _exit: nothing of the test's own state
// (GoogleTest, the harness, open files) runs down in it.
inline bool asUser(uid_t uid, const std::function<bool()>& steps) {
    const pid_t pid = ::fork();
    if (pid < 0) {
        return false;
    }
    if (pid == 0) {
        const bool dropped =
            ::setgroups(0, nullptr) == 0 && ::setgid(uid) == 0 && ::setuid(uid) == 0;
        ::_exit(dropped && steps() ? 0 : 1);
    }
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

inline bool asAttacker(const std::function<bool()>& steps) {
    return asUser(kAttackerUID, steps);
}

// Mode, owner and group of every item below `path` and of `path` itself,
// links not followed; equal snapshots mean nothing there was changed,
// added or removed (contents aside).
using TreeSnapshot = std::map<std::string, std::tuple<mode_t, uid_t, gid_t>>;
inline TreeSnapshot snapshotOf(const std::filesystem::path& path) {
    TreeSnapshot out;
    const auto record = [&](const std::filesystem::path& item) {
        struct stat st {};
        if (::lstat(item.c_str(), &st) == 0) {
            out[std::filesystem::relative(item, path).string()] = {st.st_mode, st.st_uid,
                                                                   st.st_gid};
        }
    };
    record(path);
    std::error_code error;
    for (std::filesystem::recursive_directory_iterator it(path, error), end; !error && it != end;
         it.increment(error)) {
        record(it->path());
    }
    return out;
}

// A daemon of its own per test, on a root the attacker can reach (mkdtemp
// made it 0700).
class AttackTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::filesystem::permissions(daemon_.root(), std::filesystem::perms(0755));
        ASSERT_TRUE(daemon_.start());
    }

    // The path of a container a privileged client made or found; empty
    // (and the test failed) when there is none.
    std::filesystem::path create(const std::string& identifier, std::uint64_t cls,
                                 bool transient = false) {
        const Value reply =
            daemon_.request(QRNClientRequests::createOrLookup(identifier, cls, true, transient));
        const Value* path = reply.get("ReplyPath");
        EXPECT_TRUE(path && path->asString()) << reply.description();
        return path && path->asString() ? std::filesystem::path(*path->asString())
                                        : std::filesystem::path();
    }

    DaemonHarness daemon_;
};

} // namespace quarn::test
