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

class CreateDirectoryTest : public TempRootTest {
protected:
    void SetUp() override { previousUmask_ = ::umask(0); }
    void TearDown() override { ::umask(previousUmask_); }

    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
    fs::path base() { return root_ / "/private/var/containers"; }

    mode_t previousUmask_ = 0;
};

TEST_F(CreateDirectoryTest, MakePathGivesEveryCreatedLevelTheModeButOnlyTheLeafOwnerAndClass) {
    fs::create_directories(base());
    auto leaf = base() / "a" / "b" / "c";
    ASSERT_TRUE(manager().createDirectoryAtURL(leaf, true, 0711, kMobileUID, 3));

    for (auto p : {base() / "a", base() / "a" / "b", leaf}) {
        auto st = lstatOf(p);
        EXPECT_TRUE(S_ISDIR(st.st_mode)) << p;
        EXPECT_EQ(st.st_mode & 07777, 0711u) << p;
    }
    EXPECT_EQ(lstatOf(leaf).st_uid, kMobileUID);
    EXPECT_EQ(lstatOf(leaf).st_gid, kMobileUID); // owner number used as group too
    EXPECT_EQ(xattrOf(leaf, kProtectionClassAttribute), "3");
    EXPECT_EQ(lstatOf(base() / "a").st_uid, 0u);
    EXPECT_FALSE(xattrOf(base() / "a", kProtectionClassAttribute));
    // The level that already existed keeps its own mode.
    EXPECT_NE(lstatOf(base()).st_mode & 07777, 0711u);
}

TEST_F(CreateDirectoryTest, ExistingDirectoryIsSuccessAndStillGetsClassAndOwner) {
    auto dir = base() / "existing";
    fs::create_directories(dir);
    ::chmod(dir.c_str(), 0700);
    for (bool intermediate : {true, false}) {
        ASSERT_TRUE(manager().createDirectoryAtURL(dir, intermediate, 0755, kMobileUID, 2));
        EXPECT_EQ(lstatOf(dir).st_uid, kMobileUID);
        EXPECT_EQ(xattrOf(dir, kProtectionClassAttribute), "2");
        ::chown(dir.c_str(), 0, 0);
    }
    EXPECT_EQ(lstatOf(dir).st_mode & 07777, 0700u) << "mode of an existing level is left";
}

TEST_F(CreateDirectoryTest, ShortFormsLeaveClassOrOwnerAlone) {
    fs::create_directories(base());
    ASSERT_TRUE(manager().createDirectoryAtURL(base() / "owned", false, 0755,
                                               QRNFileManager::Owner{kMobileUID}));
    EXPECT_EQ(lstatOf(base() / "owned").st_uid, kMobileUID);
    EXPECT_FALSE(xattrOf(base() / "owned", kProtectionClassAttribute));

    ASSERT_TRUE(manager().createDirectoryAtURL(base() / "classed", false, 0755,
                                               QRNFileManager::ProtectionClass{4}));
    EXPECT_EQ(lstatOf(base() / "classed").st_uid, 0u);
    EXPECT_EQ(xattrOf(base() / "classed", kProtectionClassAttribute), "4");

    ASSERT_TRUE(manager().createDirectoryAtURL(base() / "plain", false, 0700));
    EXPECT_EQ(lstatOf(base() / "plain").st_mode & 07777, 0700u);
    EXPECT_FALSE(xattrOf(base() / "plain", kProtectionClassAttribute));
}

TEST_F(CreateDirectoryTest, FailuresCarryTheErrnoAndTheirMessage) {
    LogCapture log;
    fs::create_directories(base());

    auto missingParent = manager().createDirectoryAtURL(base() / "no" / "leaf", false, 0755);
    ASSERT_FALSE(missingParent);
    EXPECT_TRUE(missingParent.error().isPOSIX(ENOENT));
    EXPECT_EQ(missingParent.error().message, "mkdir of " + (base() / "no" / "leaf").string() +
                                                 " failed: No such file or directory");
    EXPECT_NE(missingParent.error().function.find("createDirectoryAtURL"), std::string::npos);
    EXPECT_GT(missingParent.error().line, 0);

    // A file where a level should be: neither form takes it for a directory.
    writeFile(base() / "file", "x");
    auto underFile = manager().createDirectoryAtURL(base() / "file" / "leaf", true, 0755);
    ASSERT_FALSE(underFile);
    EXPECT_TRUE(underFile.error().isPOSIX(ENOTDIR));
    EXPECT_EQ(underFile.error().message.rfind("mkpath of ", 0), 0u);
    auto atFile = manager().createDirectoryAtURL(base() / "file", false, 0755, kMobileUID, 1);
    ASSERT_FALSE(atFile);
    EXPECT_TRUE(atFile.error().isPOSIX(ENOTDIR));
    EXPECT_EQ(lstatOf(base() / "file").st_uid, 0u);
    EXPECT_TRUE(log.contains("mkdir of " + (base() / "no" / "leaf").string()));
}

TEST_F(CreateDirectoryTest, LinkAtTheLeafIsNotFollowedForClassOrOwner) {
    auto target = base() / "target";
    fs::create_directories(target);
    fs::create_directory_symlink(target, base() / "link");
    auto made = manager().createDirectoryAtURL(base() / "link", true, 0755, kMobileUID, 2);
    ASSERT_FALSE(made);
    EXPECT_TRUE(made.error().isPOSIX(ENOTDIR));
    EXPECT_EQ(lstatOf(target).st_uid, 0u);
    EXPECT_FALSE(xattrOf(target, kProtectionClassAttribute));
}

TEST_F(CreateDirectoryTest, ClassAndOwnerFailuresAreReportedWithTheirMessages) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager manager(root_.context(), env);
    fs::create_directories(base());

    env->failCall(EnvCall::SetXattr, 1, EIO);
    auto classFailed = manager.createDirectoryAtURL(base() / "c", false, 0755, kMobileUID, 3);
    ASSERT_FALSE(classFailed);
    EXPECT_TRUE(classFailed.error().isPOSIX(EIO));
    EXPECT_EQ(classFailed.error().message, "Failed to setclass(3) on directory " +
                                               (base() / "c").string() + ": Input/output error");
    EXPECT_EQ(lstatOf(base() / "c").st_uid, 0u) << "owner is applied after the class";

    env->failCall(EnvCall::Chown, 1, EPERM);
    auto chownFailed = manager.createDirectoryAtURL(base() / "c", false, 0755, kMobileUID, -1);
    ASSERT_FALSE(chownFailed);
    EXPECT_EQ(chownFailed.error().message,
              "Failed to chown(501,501) " + (base() / "c").string() + ": Operation not permitted");

    env->failCall(EnvCall::Mkdir, 2, ENOSPC);
    auto deep = manager.createDirectoryAtURL(base() / "x" / "y" / "z", true, 0755);
    ASSERT_FALSE(deep);
    EXPECT_TRUE(deep.error().isPOSIX(ENOSPC));
    EXPECT_TRUE(existsNoFollow(base() / "x"));
    EXPECT_FALSE(existsNoFollow(base() / "x" / "y"));
}

TEST_F(CreateDirectoryTest, ExistingDirectoryWithItsOwnerAlreadyIsNotChownedAgain) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager manager(root_.context(), env);
    auto dir = base() / "owned";
    fs::create_directories(dir);
    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, kMobileUID), 0);

    const auto chowns = env->count(EnvCall::Chown);
    ASSERT_TRUE(manager.createDirectoryAtURL(dir, true, 0755, kMobileUID, -1));
    EXPECT_EQ(env->count(EnvCall::Chown), chowns);

    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, 0), 0); // the group differs
    ASSERT_TRUE(manager.createDirectoryAtURL(dir, true, 0755, kMobileUID, -1));
    EXPECT_EQ(lstatOf(dir).st_gid, kMobileUID);
}

TEST_F(CreateDirectoryTest, OpenedDirectoryIsTheMadeOneAndTakesChildrenBelowIt) {
    fs::create_directories(base());
    auto top = manager().createAndOpenDirectoryAtURL(base() / "top", true, 0755, kMobileUID, 0);
    ASSERT_TRUE(top);
    struct stat opened {};
    ASSERT_EQ(::fstat(top->get(), &opened), 0);
    EXPECT_EQ(opened.st_ino, lstatOf(base() / "top").st_ino);

    // Missing levels are made with the mode; only the leaf gets owner and class.
    auto deep = manager().createAndOpenDirectoryInDirectory(*top, base() / "top", "a/b", 0711,
                                                            kMobileUID, 3);
    ASSERT_TRUE(deep);
    EXPECT_EQ(lstatOf(base() / "top" / "a").st_mode & 07777, 0711u);
    EXPECT_EQ(lstatOf(base() / "top" / "a").st_uid, 0u);
    EXPECT_EQ(lstatOf(base() / "top" / "a" / "b").st_uid, kMobileUID);
    EXPECT_EQ(xattrOf(base() / "top" / "a" / "b", kProtectionClassAttribute), "3");

    auto child = manager().createAndOpenDirectoryInDirectory(*deep, base() / "top" / "a" / "b", "c",
                                                             0755, kMobileUID, 2);
    ASSERT_TRUE(child);
    EXPECT_EQ(xattrOf(base() / "top" / "a" / "b" / "c", kProtectionClassAttribute), "2");
    // Made again: success, the class is set again.
    auto again = manager().createAndOpenDirectoryInDirectory(*top, base() / "top", "a/b/c", 0755,
                                                             kMobileUID, 4);
    ASSERT_TRUE(again);
    EXPECT_EQ(xattrOf(base() / "top" / "a" / "b" / "c", kProtectionClassAttribute), "4");
}

TEST_F(CreateDirectoryTest, RelativeCreationStaysBelowItsDirectoryAndFollowsNoLink) {
    fs::create_directories(base() / "top");
    fs::create_directories(base() / "outside");
    fs::create_directory_symlink(base() / "outside", base() / "top" / "link");
    auto top = manager().createAndOpenDirectoryAtURL(base() / "top", false, 0755, 0, -1);
    ASSERT_TRUE(top);

    for (const char* relative : {"../escaped", "/abs", "", "a/../b", "."}) {
        auto made = manager().createAndOpenDirectoryInDirectory(*top, base() / "top", relative,
                                                                0755, 0, -1);
        ASSERT_FALSE(made) << relative;
        EXPECT_TRUE(made.error().isPOSIX(EINVAL)) << relative;
    }
    EXPECT_FALSE(existsNoFollow(base() / "escaped"));

    auto through = manager().createAndOpenDirectoryInDirectory(*top, base() / "top", "link/x", 0755,
                                                               kMobileUID, 1);
    ASSERT_FALSE(through);
    EXPECT_TRUE(through.error().isPOSIX(ENOTDIR));
    EXPECT_EQ(
        through.error().message.rfind("mkpath of " + (base() / "top" / "link" / "x").string(), 0),
        0u);
    auto atLink = manager().createAndOpenDirectoryInDirectory(*top, base() / "top", "link", 0755,
                                                              kMobileUID, 1);
    ASSERT_FALSE(atLink);
    EXPECT_TRUE(atLink.error().isPOSIX(ENOTDIR));
    EXPECT_FALSE(existsNoFollow(base() / "outside" / "x"));
    EXPECT_EQ(lstatOf(base() / "outside").st_uid, 0u);
    EXPECT_FALSE(xattrOf(base() / "outside", kProtectionClassAttribute));
}

} // namespace
} // namespace quarn::test
