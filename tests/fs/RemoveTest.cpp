#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <sys/stat.h>
#include <unistd.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class RemoveTest : public TempRootTest {
protected:
    void SetUp() override {
        env_ = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
        manager_ = std::make_unique<QRNFileManager>(root_.context(), env_);
        fs::create_directories(dir());
    }

    fs::path dir() { return root_ / "/private/var/containers/Data"; }

    // a/{f1,f2,b/{f3,c/{f4}},empty/}, a link and a fifo.
    fs::path makeTree() {
        auto top = dir() / "a";
        fs::create_directories(top / "b" / "c");
        fs::create_directories(top / "empty");
        writeFile(top / "f1", "1");
        writeFile(top / "f2", "2");
        writeFile(top / "b" / "f3", "3");
        writeFile(top / "b" / "c" / "f4", "4");
        fs::create_symlink("f1", top / "link");
        ::mkfifo((top / "b" / "fifo").c_str(), 0600);
        return top;
    }

    std::shared_ptr<FaultInjectingEnv> env_;
    std::unique_ptr<QRNFileManager> manager_;
};

TEST_F(RemoveTest, RemovesWholeTreesAndTreatsMissingItemsAsSuccess) {
    auto top = makeTree();
    ASSERT_TRUE(manager_->removeItemAtURL(top));
    EXPECT_FALSE(existsNoFollow(top));
    EXPECT_EQ(countEntries(dir()), 0);

    EXPECT_TRUE(manager_->removeItemAtURL(top)) << "already gone";
    EXPECT_TRUE(manager_->removeItemAtURL(dir() / "no" / "such" / "parent"));

    writeFile(dir() / "file", "x");
    EXPECT_TRUE(manager_->removeItemAtURL(dir() / "file"));
    EXPECT_FALSE(existsNoFollow(dir() / "file"));

    makeTree();
    EXPECT_TRUE(manager_->removeItemAtURL(dir().string() + "/a/")) << "trailing separator";
    EXPECT_FALSE(existsNoFollow(dir() / "a"));
}

TEST_F(RemoveTest, EmptyURLIsRefusedWithEFAULT) {
    auto removed = manager_->removeItemAtURL({});
    ASSERT_FALSE(removed);
    EXPECT_TRUE(removed.error().isPOSIX(EFAULT));
    EXPECT_EQ(removed.error().message, "nil url passed to -removeItemAtURL:error:");
}

TEST_F(RemoveTest, LinksAreRemovedNeverFollowed) {
    auto outside = root_ / "/outside";
    fs::create_directories(outside / "sub");
    writeFile(outside / "sub" / "keep", "k");
    writeFile(outside / "keepfile", "k");

    auto top = makeTree();
    fs::create_directory_symlink(outside, top / "b" / "dirlink");
    fs::create_symlink(outside / "keepfile", top / "filelink");
    fs::create_symlink(outside / "sub", dir() / "rootlink");

    ASSERT_TRUE(manager_->removeItemAtURL(top));
    ASSERT_TRUE(manager_->removeItemAtURL(dir() / "rootlink")) << "the root itself a link";
    EXPECT_FALSE(existsNoFollow(top));
    EXPECT_FALSE(existsNoFollow(dir() / "rootlink"));
    EXPECT_EQ(readFile(outside / "sub" / "keep"), "k");
    EXPECT_EQ(readFile(outside / "keepfile"), "k");
}

TEST_F(RemoveTest, TenThousandEntriesAreAllRemoved) {
    auto top = dir() / "big";
    for (int d = 0; d < 100; ++d) {
        auto sub = top / ("d" + std::to_string(d));
        fs::create_directories(sub);
        for (int f = 0; f < 100; ++f) {
            writeFile(sub / ("f" + std::to_string(f)), "");
        }
    }
    ASSERT_EQ(countEntries(top), 10100);
    ASSERT_TRUE(manager_->removeItemAtURL(top));
    EXPECT_FALSE(existsNoFollow(top));
    // One unlink per entry and one stat for the root: nothing walked twice.
    EXPECT_EQ(env_->count(EnvCall::Unlink), 10101u);
}

TEST_F(RemoveTest, TreesDeeperThanAPathCanBeAreRemoved) {
    auto top = dir() / "deep";
    makeDeepTree(top, 150); // about 6000 characters of path
    ASSERT_TRUE(manager_->removeItemAtURL(top));
    EXPECT_FALSE(existsNoFollow(top));
}

TEST_F(RemoveTest, ImmutableEntriesHaveTheFlagClearedAndAreRemoved) {
    auto top = makeTree();
    fs::create_directories(top / "frozen" / "inner");
    writeFile(top / "frozen" / "inner" / "f", "x");
    fs::create_directories(top / "frozenEmpty");
    writeFile(top / "frozen" / "g", "g");
    int err = setImmutable(top / "f1", true);
    if (err == EOPNOTSUPP || err == ENOTTY || err == EINVAL) {
        GTEST_SKIP() << "the file system of " << top << " refuses the immutable flag ("
                     << std::strerror(err) << ")";
    }
    ASSERT_EQ(err, 0);
    // A directory that is immutable blocks removing what is inside it.
    ASSERT_EQ(setImmutable(top / "frozen", true), 0);
    ASSERT_EQ(setImmutable(top / "frozenEmpty", true), 0);
    ASSERT_EQ(::unlink((top / "frozen" / "inner" / "f").c_str()), 0) << "inner is not frozen";
    ASSERT_NE(::unlink((top / "frozen" / "g").c_str()), 0);

    LogCapture log;
    auto removed = manager_->removeItemAtURL(top);
    setImmutable(top / "f1", false); // let the fixture clean up if it failed
    setImmutable(top / "frozen", false);
    setImmutable(top / "frozenEmpty", false);
    ASSERT_TRUE(removed) << removed.error().description() << "\n" << log.all();
    EXPECT_FALSE(existsNoFollow(top));
    EXPECT_TRUE(log.contains("Unset the immutable flag on " + (top / "f1").string()));
    EXPECT_TRUE(log.contains("Unset the immutable flag on " + (top / "frozen").string()));
    EXPECT_TRUE(log.contains("Unset the immutable flag on " + (top / "frozenEmpty").string()));
    auto messages = log.messages();
    EXPECT_EQ(std::count(messages.begin(), messages.end(),
                         "Unset the immutable flag on " + (top / "frozen").string()),
              1)
        << "cleared once, not once per child";
}

TEST_F(RemoveTest, AFailingEntryIsReportedWhileTheRestOfTheTreeGoes) {
    auto top = makeTree();
    LogCapture log;
    env_->failCall(EnvCall::Unlink, 3, EIO);
    env_->failCall(EnvCall::Unlink, 5, EACCES);
    auto removed = manager_->removeItemAtURL(top);
    ASSERT_FALSE(removed);
    EXPECT_TRUE(removed.error().isPOSIX(EIO)) << "the first error wins";
    EXPECT_EQ(removed.error().message, "remove of " + top.string() + " failed: Input/output error");
    EXPECT_TRUE(log.contains("remove hit error for "));
    // Only the two entries that failed and the directories holding them are left.
    long left = countEntries(top);
    EXPECT_GE(left, 1);
    EXPECT_LE(left, 4);
    EXPECT_GT(env_->count(EnvCall::Unlink), 9u) << "the walk went on";

    env_->clearFailures();
    ASSERT_TRUE(manager_->removeItemAtURL(top));
    EXPECT_FALSE(existsNoFollow(top));
}

TEST_F(RemoveTest, PermissionFailureWithoutImmutableFlagIsRecorded) {
    auto top = makeTree();
    env_->failCall(EnvCall::Unlink, 1, EPERM);
    auto removed = manager_->removeItemAtURL(top);
    ASSERT_FALSE(removed);
    EXPECT_TRUE(removed.error().isPOSIX(EPERM));
    EXPECT_EQ(env_->count(EnvCall::SetFlags), 0u) << "no flag was in the way";
}

TEST_F(RemoveTest, DirectoryThatCannotBeReadIsReported) {
    auto top = makeTree();
    env_->failCall(EnvCall::ReadDir, 2, EIO);
    auto removed = manager_->removeItemAtURL(top);
    ASSERT_FALSE(removed);
    EXPECT_TRUE(removed.error().isPOSIX(EIO));
    EXPECT_TRUE(existsNoFollow(top));
}

} // namespace
} // namespace quarn::test
