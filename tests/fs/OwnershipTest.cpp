#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class OwnershipTest : public TempRootTest {
protected:
    void SetUp() override {
        make(tree(), 0700);
        make(tree() / "sub", 0700);
        make(tree() / "sub" / "deeper", 0555);
        file(tree() / "plain", 0600);
        file(tree() / "sub" / "tool", 0700);
        file(tree() / "sub" / "group-exec", 0610);
        file(tree() / "sub" / "setuid", 04644);
        file(metadata(), 0600);
        file(root_ / "/outside", 0600);
        fs::create_symlink(root_ / "/outside", tree() / "sub" / "link");
    }
    void make(const fs::path& p, mode_t mode) {
        fs::create_directories(p);
        ::chmod(p.c_str(), mode);
    }
    void file(const fs::path& p, mode_t mode) {
        writeFile(p, "x");
        ::chmod(p.c_str(), mode);
    }
    fs::path tree() { return root_ / "/private/var/mobile/Containers/Data/A"; }
    fs::path metadata() { return tree() / ".com.orvex.quarn_store.metadata.plist"; }
    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
};

TEST_F(OwnershipTest, OwnerAndModeAreForcedOverTheTree) {
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(tree(), kMobileUID, kMobileUID));

    const std::pair<fs::path, mode_t> expected[] = {
        {tree(), 0755},
        {tree() / "sub", 0755},
        {tree() / "sub" / "deeper", 0755},
        {tree() / "plain", 0644},
        {tree() / "sub" / "tool", 0755},
        {tree() / "sub" / "group-exec", 0755},
        {tree() / "sub" / "setuid", 0644},
    };
    for (const auto& [path, mode] : expected) {
        auto st = lstatOf(path);
        EXPECT_EQ(st.st_mode & 07777, mode) << path;
        EXPECT_EQ(st.st_uid, kMobileUID) << path;
        EXPECT_EQ(st.st_gid, kMobileUID) << path;
    }
    EXPECT_EQ(lstatOf(tree() / "sub" / "link").st_uid, kMobileUID) << "the link itself";

    auto meta = lstatOf(metadata());
    EXPECT_EQ(meta.st_uid, 0u);
    EXPECT_EQ(meta.st_mode & 07777, 0600u);
    auto outside = lstatOf(root_ / "/outside");
    EXPECT_EQ(outside.st_uid, 0u);
    EXPECT_EQ(outside.st_mode & 07777, 0600u);
}

TEST_F(OwnershipTest, EntriesAlreadyOwnedAreNotChowned) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager counted(root_.context(), env);
    ASSERT_TRUE(counted.standardizeOwnershipAtURL(tree(), 0, 0));
    EXPECT_EQ(env->count(EnvCall::Chown), 0u);
    EXPECT_EQ(lstatOf(tree() / "plain").st_mode & 07777, 0644u) << "the mode is still set";
}

TEST_F(OwnershipTest, FailuresOfOneEntryDoNotStopTheRest) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager faulty(root_.context(), env);
    LogCapture log;
    env->failCall(EnvCall::Chown, 2, EIO);
    env->failCall(EnvCall::Chmod, 3, EIO);
    ASSERT_TRUE(faulty.standardizeOwnershipAtURL(tree(), kMobileUID, kMobileUID));
    EXPECT_EQ(log.count("Could not chown"), 1u) << log.all();
    EXPECT_EQ(log.count("Could not chmod"), 1u) << log.all();
    int owned = 0;
    for (auto p : {tree(), tree() / "sub", tree() / "sub" / "deeper", tree() / "plain",
                   tree() / "sub" / "tool", tree() / "sub" / "group-exec",
                   tree() / "sub" / "setuid", tree() / "sub" / "link"}) {
        owned += lstatOf(p).st_uid == kMobileUID;
    }
    EXPECT_EQ(owned, 7);
}

TEST_F(OwnershipTest, MissingRootFailsWithItsErrno) {
    LogCapture log;
    auto result = manager().standardizeOwnershipAtURL(tree() / "missing", kMobileUID, kMobileUID);
    ASSERT_FALSE(result);
    EXPECT_TRUE(result.error().isPOSIX(ENOENT));
    EXPECT_TRUE(log.contains("Could not stat " + (tree() / "missing").string()));
}

} // namespace
} // namespace quarn::test
