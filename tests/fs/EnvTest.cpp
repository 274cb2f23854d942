// The system calls as values, and the fault injection the other tests rely on.
#include "FsTestSupport.h"

namespace quarn::test {
namespace {

bool isOpen(int fd) {
    return ::fcntl(fd, F_GETFD) != -1;
}

class EnvTest : public TempRootTest {
protected:
    LinuxEnv linux_;
};

TEST_F(EnvTest, LinuxCallsReportErrnoAsValuesAndNeverLeakDescriptors) {
    auto missing = linux_.openat(AT_FDCWD, (root_.path() / "missing").c_str(), O_RDONLY, 0);
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error(), ENOENT);
    auto exists = linux_.mkdirat(AT_FDCWD, root_.path().c_str(), 0755);
    ASSERT_FALSE(exists);
    EXPECT_EQ(exists.error(), EEXIST);

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

TEST_F(EnvTest, ReadlinkKeepsToTheBufferSize) {
    fs::create_symlink("0123456789", root_.path() / "link");
    auto whole = linux_.readlinkat(AT_FDCWD, (root_.path() / "link").c_str(), 1024);
    ASSERT_TRUE(whole);
    EXPECT_EQ(*whole, "0123456789");
    auto cut = linux_.readlinkat(AT_FDCWD, (root_.path() / "link").c_str(), 4);
    ASSERT_TRUE(cut);
    EXPECT_EQ(*cut, "0123");
}

TEST_F(EnvTest, FaultsHitExactlyTheChosenCallsCountedFromNow) {
    FaultInjectingEnv env(std::make_shared<LinuxEnv>());
    const auto path = root_.path().string();
    ASSERT_TRUE(env.fstatat(AT_FDCWD, path.c_str(), 0));
    env.failCall(EnvCall::Stat, 2, EIO);
    env.failCallsFrom(EnvCall::Mkdir, 3, ENOSPC);
    EXPECT_TRUE(env.fstatat(AT_FDCWD, path.c_str(), 0));
    auto second = env.fstatat(AT_FDCWD, path.c_str(), 0);
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error(), EIO);
    EXPECT_TRUE(env.fstatat(AT_FDCWD, path.c_str(), 0)) << "only that one call";
    EXPECT_EQ(env.count(EnvCall::Stat), 4u);

    std::vector<int> mkdirErrors;
    for (int i = 0; i < 5; ++i) {
        auto made = env.mkdirat(AT_FDCWD, (path + "/d" + std::to_string(i)).c_str(), 0755);
        mkdirErrors.push_back(made ? 0 : made.error());
    }
    EXPECT_EQ(mkdirErrors, (std::vector<int>{0, 0, ENOSPC, ENOSPC, ENOSPC}));
    EXPECT_FALSE(fs::exists(root_.path() / "d2")) << "a failed call does not reach the system";
    EXPECT_EQ(env.injectedFailures(), 4u);

    env.clearFailures();
    EXPECT_TRUE(env.mkdirat(AT_FDCWD, (path + "/d9").c_str(), 0755));
}

TEST_F(EnvTest, InjectedCloseFailuresStillReleaseAndTheHookSeesEveryCall) {
    FaultInjectingEnv env(std::make_shared<LinuxEnv>());
    std::vector<std::pair<EnvCall, std::uint64_t>> seen;
    env.setHook([&](EnvCall call, std::uint64_t n) { seen.emplace_back(call, n); });

    auto fd = env.openat(AT_FDCWD, root_.path().c_str(), O_RDONLY | O_DIRECTORY, 0);
    ASSERT_TRUE(fd);
    env.failCall(EnvCall::Close, 1, EIO);
    auto closed = env.close(*fd);
    ASSERT_FALSE(closed);
    EXPECT_FALSE(isOpen(*fd));

    auto dirFd = env.openat(AT_FDCWD, root_.path().c_str(), O_RDONLY | O_DIRECTORY, 0);
    ASSERT_TRUE(dirFd);
    env.failCall(EnvCall::OpenDir, 1, ENOMEM);
    ASSERT_FALSE(env.fdopendir(*dirFd));
    EXPECT_FALSE(isOpen(*dirFd)) << "handed over even when the stream was refused";

    using P = std::pair<EnvCall, std::uint64_t>;
    EXPECT_EQ(seen, (std::vector<P>{P{EnvCall::Open, 1}, P{EnvCall::Close, 1}, P{EnvCall::Open, 2},
                                    P{EnvCall::OpenDir, 1}}));
}

} // namespace
} // namespace quarn::test
