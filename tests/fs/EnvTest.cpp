// The system calls as values, and the fault injection the other tests rely on.
#include "FsTestSupport.h"

namespace quarn::test {
namespace {

class EnvTest : public TempRootTest {
protected:
    static bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) != -1; }
    LinuxEnv linux_;
};

TEST_F(EnvTest, DescriptorsAreCloseOnExecAndNeverLeak) {
    auto fd = linux_.openat(AT_FDCWD, root_.path().c_str(), O_RDONLY | O_DIRECTORY, 0);
    ASSERT_TRUE(fd);
    EXPECT_TRUE(::fcntl(*fd, F_GETFD) & FD_CLOEXEC) << "close-on-exec is always added";
    auto dir = linux_.fdopendir(*fd);
    ASSERT_TRUE(dir);
    int seen = 0;
    auto entry = linux_.readdir(*dir);
    for (; entry && *entry; entry = linux_.readdir(*dir))
        ++seen;
    EXPECT_TRUE(entry) << "the end is a null entry, not an error";
    EXPECT_GE(seen, 3); // ".", "..", "etc", ...
    EXPECT_TRUE(linux_.closedir(*dir));

    // A descriptor handed to fdopendir is released even when that fails.
    writeFile(root_.path() / "file", "x");
    auto fileFd = linux_.openat(AT_FDCWD, (root_.path() / "file").c_str(), O_RDONLY, 0);
    ASSERT_TRUE(fileFd);
    auto notDir = linux_.fdopendir(*fileFd);
    ASSERT_FALSE(notDir);
    EXPECT_EQ(notDir.error(), ENOTDIR);
    EXPECT_FALSE(isOpen(*fileFd));
}

TEST_F(EnvTest, FaultsHitExactlyTheChosenCallsCountedFromNowAndTheHookSeesEveryCall) {
    FaultInjectingEnv env(std::make_shared<LinuxEnv>());
    const auto path = root_.path().string();
    std::vector<int> errors;
    auto stat = [&] {
        auto st = env.fstatat(AT_FDCWD, path.c_str(), 0);
        errors.push_back(st ? 0 : st.error());
    };
    auto mkdir = [&](int i) {
        auto made = env.mkdirat(AT_FDCWD, (path + "/d" + std::to_string(i)).c_str(), 0755);
        errors.push_back(made ? 0 : made.error());
    };
    stat();
    env.failCall(EnvCall::Stat, 2, EIO);
    env.failCallsFrom(EnvCall::Mkdir, 3, ENOSPC);
    for (int i = 0; i < 3; ++i)
        stat();
    for (int i = 0; i < 5; ++i)
        mkdir(i);
    EXPECT_EQ(errors, (std::vector<int>{0, 0, EIO, 0, 0, 0, ENOSPC, ENOSPC, ENOSPC}));
    EXPECT_EQ(env.count(EnvCall::Stat), 4u);
    EXPECT_FALSE(fs::exists(root_.path() / "d2")) << "a failed call does not reach the system";
    EXPECT_EQ(env.injectedFailures(), 4u);
    env.clearFailures();
    mkdir(9);
    EXPECT_EQ(errors.back(), 0);

    // Injected close and fdopendir failures still release the descriptor.
    std::vector<std::pair<EnvCall, std::uint64_t>> seen;
    env.setHook([&](EnvCall call, std::uint64_t n) { seen.emplace_back(call, n); });
    for (auto call : {EnvCall::Close, EnvCall::OpenDir}) {
        auto fd = env.openat(AT_FDCWD, path.c_str(), O_RDONLY | O_DIRECTORY, 0);
        ASSERT_TRUE(fd);
        env.failCall(call, 1, EIO);
        EXPECT_FALSE(call == EnvCall::Close ? bool(env.close(*fd)) : bool(env.fdopendir(*fd)));
        EXPECT_FALSE(isOpen(*fd)) << envCallName(call);
    }
    using P = std::pair<EnvCall, std::uint64_t>;
    EXPECT_EQ(seen, (std::vector<P>{P{EnvCall::Open, 1}, P{EnvCall::Close, 1}, P{EnvCall::Open, 2},
                                    P{EnvCall::OpenDir, 1}}));
}

} // namespace
} // namespace quarn::test
