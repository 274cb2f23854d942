// Containment of paths, making directories, temporary directories, homes.
#include "FsTestSupport.h"

namespace quarn::test {
namespace {

class ContainmentTest : public FsTest {
protected:
    void SetUp() override {
        fs::create_directories(base() / "sub");
        fs::create_directories(root_ / "/private/var/other");
        writeFile(base() / "file", "inside");
    }
    fs::path base() { return root_ / "/private/var/containers/Data/X"; }
    std::optional<fs::path> check(const fs::path& p) { return manager_.realPathForURL(p, base()); }
    fs::path real(const fs::path& p) { return fs::canonical(p); }
    void link(const std::string& target, const fs::path& at) { fs::create_symlink(target, at); }

    LogCapture log_;
};

TEST_F(ContainmentTest, PlainItemsAndThePrivatePrefix) {
    EXPECT_EQ(check(base() / "file"), real(base() / "file"));
    EXPECT_EQ(check(base()), real(base())) << "the base itself";
    EXPECT_FALSE(check(root_ / "/private/var/other"));
    EXPECT_TRUE(log_.contains("does not contain base path"));
    // A sibling whose name extends the base's passes the string check only.
    fs::create_directories(base().string() + "Y");
    EXPECT_FALSE(check(base().string() + "Y"));
    EXPECT_TRUE(log_.contains("because components diverge at X != XY")) << log_.all();

    // "/private" is dropped below the root for the string checks; without
    // "<root>/var" the base then cannot be resolved.
    const auto deviceStyleBase = root_ / "/var/containers/Data/X";
    EXPECT_FALSE(manager_.realPathForURL(base() / "a", deviceStyleBase));
    EXPECT_TRUE(log_.contains("for base path " + deviceStyleBase.string() + " "));
    link("private/var", root_ / "/var"); // as on the device
    EXPECT_EQ(manager_.realPathForURL(base() / "a", deviceStyleBase), real(base()) / "a");
    EXPECT_EQ(manager_.realPathForURL(deviceStyleBase / "file", base()), real(base() / "file"));
    EXPECT_FALSE(manager_.realPathForURL(base(), "/"));
    EXPECT_TRUE(log_.contains("because real component counts don't make sense"));
}

TEST_F(ContainmentTest, DotDotIsRejectedBeforeAnyFileSystemAccess) {
    EXPECT_FALSE(check(base() / "sub" / ".." / "file")); // though inside
    EXPECT_TRUE(log_.contains("contains '..' paths, which are invalid"));
    for (auto call : {EnvCall::Readlink, EnvCall::Realpath, EnvCall::Stat, EnvCall::Open})
        EXPECT_EQ(env_->count(call), 0u) << envCallName(call);
}

TEST_F(ContainmentTest, LinkTargetsMustStayInsideTheBase) {
    link("../../other", base() / "sub" / "out");
    EXPECT_FALSE(check(base() / "sub" / "out"));
    EXPECT_TRUE(log_.contains("as it is points outside or to the base"));
    link("../file", base() / "sub" / "up");
    EXPECT_EQ(check(base() / "sub" / "up"), real(base() / "file"));
    link("/etc", base() / "abs");
    EXPECT_FALSE(check(base() / "abs"));
    EXPECT_TRUE(log_.contains("as absolute symlinks are not allowed"));
    link("..", base() / "sub" / "home"); // the base itself: not outside
    EXPECT_EQ(check(base() / "sub" / "home"), real(base()));
    link("..", base() / "parent");
    EXPECT_FALSE(check(base() / "parent"));

    // The depth check sees one hop: later hops and parent links are caught
    // by comparing real paths.
    link("hop", base() / "start");
    link("../../../other", base() / "hop");
    EXPECT_FALSE(check(base() / "start"));
    EXPECT_TRUE(log_.contains("Rejecting " + (base() / "start").string() + " with base"));
    EXPECT_FALSE(check(base() / "hop" / "x"));
    link("sub", base() / "alias");
    link("alias/../file", base() / "chain");
    EXPECT_EQ(check(base() / "chain"), real(base() / "file"));
    EXPECT_EQ(check(base() / "alias" / "new"), real(base() / "sub") / "new");

    // The depth walk fails as soon as it falls below where it started.
    const std::pair<const char*, std::optional<int>> walks[] = {
        {"/a/b", 2}, {"a/./b//c/", 5}, {"a/../b", 3}, {"../a/b", {}}, {"a/../../b/c", {}}};
    for (auto [target, depth] : walks)
        EXPECT_EQ(manager_._validateSymlink(target, target[0] == '/' ? 0 : 2), depth) << target;
}

TEST_F(ContainmentTest, MissingComponentsAreAppendedUnresolved) {
    EXPECT_EQ(check(base() / "sub" / "new" / "deeper"), real(base() / "sub") / "new" / "deeper");
    EXPECT_FALSE(manager_.realPathForURL(base() / "gone" / "a", base() / "gone"));
    EXPECT_TRUE(log_.contains("Failed to retrieve realpath for base path"));
    // A dangling link would later be followed to wherever it points.
    link("../../../elsewhere", base() / "hop");
    link("hop", base() / "dangling");
    EXPECT_FALSE(check(base() / "dangling"));
    EXPECT_FALSE(check(base() / "dangling" / "child"));
    // A file where a directory is needed is not "missing".
    EXPECT_FALSE(check(base() / "file" / "x"));
    EXPECT_TRUE(log_.contains("Readlink failed: Not a directory"));
    EXPECT_FALSE(manager_._realPathForURL(base() / "file" / "x", true));
    EXPECT_TRUE(log_.contains("Failed to realpath " + (base() / "file" / "x").string() +
                              " : Not a directory"));
}

TEST_F(ContainmentTest, ReadlinkFailuresOtherThanNotALinkReject) {
    env_->failCall(EnvCall::Readlink, 1, EACCES);
    EXPECT_FALSE(check(base() / "file"));
    EXPECT_TRUE(log_.contains("Readlink failed: Permission denied"));
    link(std::string(1024, 'a'), base() / "long"); // refused, not cut
    EXPECT_FALSE(check(base() / "long"));
    EXPECT_TRUE(log_.contains("Readlink failed: File name too long"));
}

class CreateDirectoryTest : public FsTest {
protected:
    void SetUp() override {
        previousUmask_ = ::umask(0);
        fs::create_directories(base());
    }
    void TearDown() override { ::umask(previousUmask_); }
    fs::path base() { return root_ / "/private/var/containers"; }
    // Owner, group and class of `p`, as "uid:gid:class" ("-" for no class).
    std::string ownerAndClass(const fs::path& p) {
        auto st = lstatOf(p);
        return std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid) + ":" +
               xattrOf(p).value_or("-");
    }

    mode_t previousUmask_ = 0;
};

TEST_F(CreateDirectoryTest, MakePathGivesEveryCreatedLevelTheModeButOnlyTheLeafOwnerAndClass) {
    auto leaf = base() / "a" / "b" / "c";
    ASSERT_TRUE(manager_.createDirectoryAtURL(leaf, true, 0711, kMobileUID, 3));
    for (auto p : {base() / "a", base() / "a" / "b", leaf}) {
        EXPECT_TRUE(S_ISDIR(lstatOf(p).st_mode)) << p;
        EXPECT_EQ(lstatOf(p).st_mode & 07777, 0711u) << p;
    }
    EXPECT_EQ(ownerAndClass(leaf), "501:501:3"); // owner number used as group too
    EXPECT_EQ(ownerAndClass(base() / "a"), "0:0:-");
    // The level that already existed keeps its own mode.
    EXPECT_NE(lstatOf(base()).st_mode & 07777, 0711u);
}

TEST_F(CreateDirectoryTest, ExistingDirectoryIsSuccessAndStillGetsClassAndOwner) {
    auto dir = base() / "existing";
    fs::create_directories(dir);
    ::chmod(dir.c_str(), 0700);
    for (bool intermediate : {true, false}) {
        ASSERT_TRUE(manager_.createDirectoryAtURL(dir, intermediate, 0755, kMobileUID, 2));
        EXPECT_EQ(ownerAndClass(dir), "501:501:2");
        ::chown(dir.c_str(), 0, 0);
    }
    EXPECT_EQ(lstatOf(dir).st_mode & 07777, 0700u) << "mode of an existing level is left";

    // Already owned: no chown at all; only the group differs: chowned.
    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, kMobileUID), 0);
    const auto chowns = env_->count(EnvCall::Chown);
    ASSERT_TRUE(manager_.createDirectoryAtURL(dir, true, 0755, kMobileUID, -1));
    EXPECT_EQ(env_->count(EnvCall::Chown), chowns);
    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, 0), 0);
    ASSERT_TRUE(manager_.createDirectoryAtURL(dir, true, 0755, kMobileUID, -1));
    EXPECT_EQ(lstatOf(dir).st_gid, kMobileUID);
}

TEST_F(CreateDirectoryTest, ShortFormsLeaveClassOrOwnerAlone) {
    using Q = QRNFileManager;
    ASSERT_TRUE(manager_.createDirectoryAtURL(base() / "owned", false, 0755, Q::Owner{kMobileUID}));
    ASSERT_TRUE(
        manager_.createDirectoryAtURL(base() / "classed", false, 0755, Q::ProtectionClass{4}));
    ASSERT_TRUE(manager_.createDirectoryAtURL(base() / "plain", false, 0700));
    EXPECT_EQ(ownerAndClass(base() / "owned"), "501:501:-");
    EXPECT_EQ(ownerAndClass(base() / "classed"), "0:0:4");
    EXPECT_EQ(ownerAndClass(base() / "plain"), "0:0:-");
    EXPECT_EQ(lstatOf(base() / "plain").st_mode & 07777, 0700u);
}

TEST_F(CreateDirectoryTest, FailuresCarryTheErrnoAndTheirMessage) {
    LogCapture log;
    const auto noParent = base() / "no" / "leaf";
    auto missingParent = manager_.createDirectoryAtURL(noParent, false, 0755);
    ASSERT_FALSE(missingParent);
    EXPECT_TRUE(missingParent.error().isPOSIX(ENOENT));
    EXPECT_EQ(missingParent.error().message,
              "mkdir of " + noParent.string() + " failed: No such file or directory");
    EXPECT_NE(missingParent.error().function.find("createDirectoryAtURL"), std::string::npos);
    EXPECT_GT(missingParent.error().line, 0);
    EXPECT_TRUE(log.contains("mkdir of " + noParent.string()));

    // A file, or a link to a directory, where a level should be: neither
    // form takes it for a directory, and nothing is given owner or class.
    writeFile(base() / "file", "x");
    fs::create_directories(base() / "target");
    fs::create_directory_symlink(base() / "target", base() / "link");
    auto underFile = manager_.createDirectoryAtURL(base() / "file" / "leaf", true, 0755);
    ASSERT_FALSE(underFile);
    EXPECT_TRUE(underFile.error().isPOSIX(ENOTDIR));
    EXPECT_EQ(underFile.error().message.rfind("mkpath of ", 0), 0u);
    for (auto [at, intermediate] : {std::pair{base() / "file", false}, {base() / "link", true}}) {
        auto made = manager_.createDirectoryAtURL(at, intermediate, 0755, kMobileUID, 1);
        ASSERT_FALSE(made) << at;
        EXPECT_TRUE(made.error().isPOSIX(ENOTDIR)) << at;
    }
    EXPECT_EQ(ownerAndClass(base() / "file"), "0:0:-");
    EXPECT_EQ(ownerAndClass(base() / "target"), "0:0:-");
}

TEST_F(CreateDirectoryTest, ClassAndOwnerFailuresAreReportedWithTheirMessages) {
    env_->failCall(EnvCall::SetXattr, 1, EIO);
    auto classFailed = manager_.createDirectoryAtURL(base() / "c", false, 0755, kMobileUID, 3);
    ASSERT_FALSE(classFailed);
    EXPECT_TRUE(classFailed.error().isPOSIX(EIO));
    EXPECT_EQ(classFailed.error().message, "Failed to setclass(3) on directory " +
                                               (base() / "c").string() + ": Input/output error");
    EXPECT_EQ(lstatOf(base() / "c").st_uid, 0u) << "owner is applied after the class";

    env_->failCall(EnvCall::Chown, 1, EPERM);
    auto chownFailed = manager_.createDirectoryAtURL(base() / "c", false, 0755, kMobileUID, -1);
    ASSERT_FALSE(chownFailed);
    EXPECT_EQ(chownFailed.error().message,
              "Failed to chown(501,501) " + (base() / "c").string() + ": Operation not permitted");

    env_->failCall(EnvCall::Mkdir, 2, ENOSPC);
    auto deep = manager_.createDirectoryAtURL(base() / "x" / "y" / "z", true, 0755);
    ASSERT_FALSE(deep);
    EXPECT_TRUE(deep.error().isPOSIX(ENOSPC));
    EXPECT_TRUE(existsNoFollow(base() / "x"));
    EXPECT_FALSE(existsNoFollow(base() / "x" / "y"));
}

TEST_F(CreateDirectoryTest, OpenedDirectoryIsTheMadeOneAndTakesChildrenBelowIt) {
    const auto top = base() / "top";
    auto opened = manager_.createAndOpenDirectoryAtURL(top, true, 0755, kMobileUID, 0);
    ASSERT_TRUE(opened);
    struct stat st {};
    ASSERT_EQ(::fstat(opened->get(), &st), 0);
    EXPECT_EQ(st.st_ino, lstatOf(top).st_ino);

    // Missing levels are made with the mode; only the leaf gets owner and class.
    auto deep =
        manager_.createAndOpenDirectoryInDirectory(*opened, top, "a/b", 0711, kMobileUID, 3);
    ASSERT_TRUE(deep);
    EXPECT_EQ(lstatOf(top / "a").st_mode & 07777, 0711u);
    EXPECT_EQ(ownerAndClass(top / "a"), "0:0:-");
    EXPECT_EQ(ownerAndClass(top / "a" / "b"), "501:501:3");
    ASSERT_TRUE(manager_.createAndOpenDirectoryInDirectory(*deep, top / "a" / "b", "c", 0755,
                                                           kMobileUID, 2));
    EXPECT_EQ(xattrOf(top / "a" / "b" / "c"), "2");
    // Made again: success, the class is set again.
    ASSERT_TRUE(
        manager_.createAndOpenDirectoryInDirectory(*opened, top, "a/b/c", 0755, kMobileUID, 4));
    EXPECT_EQ(xattrOf(top / "a" / "b" / "c"), "4");
}

TEST_F(CreateDirectoryTest, RelativeCreationStaysBelowItsDirectoryAndFollowsNoLink) {
    const auto top = base() / "top";
    fs::create_directories(top);
    fs::create_directories(base() / "outside");
    fs::create_directory_symlink(base() / "outside", top / "link");
    auto opened = manager_.createAndOpenDirectoryAtURL(top, false, 0755, 0, -1);
    ASSERT_TRUE(opened);

    for (const char* relative : {"../escaped", "/abs", "", "a/../b", "."}) {
        auto made = manager_.createAndOpenDirectoryInDirectory(*opened, top, relative, 0755, 0, -1);
        ASSERT_FALSE(made) << relative;
        EXPECT_TRUE(made.error().isPOSIX(EINVAL)) << relative;
    }
    EXPECT_FALSE(existsNoFollow(base() / "escaped"));

    for (const char* relative : {"link/x", "link"}) {
        auto made =
            manager_.createAndOpenDirectoryInDirectory(*opened, top, relative, 0755, kMobileUID, 1);
        ASSERT_FALSE(made) << relative;
        EXPECT_TRUE(made.error().isPOSIX(ENOTDIR)) << relative;
        if (std::string_view(relative) == "link/x") {
            EXPECT_EQ(made.error().message.rfind("mkpath of " + (top / relative).string(), 0), 0u);
        }
    }
    EXPECT_FALSE(existsNoFollow(base() / "outside" / "x"));
    EXPECT_EQ(ownerAndClass(base() / "outside"), "0:0:-");
}

TEST_F(FsTest, TemporaryDirectoriesAreUniqueAndPrivateInTheDirectory) {
    auto in = root_ / "/tmp";
    fs::create_directories(in);
    auto first = manager_.createTemporaryDirectoryInDirectoryURL(in);
    auto second = manager_.createTemporaryDirectoryInDirectoryURL(in);
    ASSERT_TRUE(first && second);
    EXPECT_NE(*first, *second);
    for (const auto& made : {*first, *second}) {
        EXPECT_EQ(made.parent_path(), in);
        EXPECT_EQ(made.filename().string().size(), std::string("temp.").size() + 6);
        EXPECT_EQ(made.filename().string().rfind("temp.", 0), 0u);
        EXPECT_EQ(lstatOf(made).st_mode & 07777, 0700u);
    }
    auto named = manager_.createTemporaryDirectoryInDirectoryURL(in, "Staging-");
    ASSERT_TRUE(named);
    EXPECT_EQ(named->filename().string().rfind("Staging-", 0), 0u);

    auto missing = manager_.createTemporaryDirectoryInDirectoryURL(root_ / "/nowhere");
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_EQ(missing.error().message, "Failed to create temp dir at path " +
                                           (root_ / "/nowhere/temp.XXXXXX").string() +
                                           " : No such file or directory");
    // A prefix must not lead out of the directory.
    auto escaping = manager_.createTemporaryDirectoryInDirectoryURL(in, "../x");
    ASSERT_FALSE(escaping);
    EXPECT_TRUE(escaping.error().isPOSIX(EINVAL));
}

TEST_F(FsTest, HomeDirectoryIsTheRealPathOfTheAccountsHomeOrMobiles) {
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(kMobileUID),
              fs::canonical(root_ / "/private/var/mobile"));
    // A home reached through a link resolves to where it really is.
    fs::create_directories(root_ / "/data/real-home");
    fs::create_directory_symlink(root_ / "/data/real-home", root_ / "/private/var/linked");
    root_.writeFile("/etc/passwd", "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                   "linked:x:600:600::/private/var/linked:/bin/sh\n"
                                   "ghost:x:601:601::/private/var/ghost:/bin/sh\n");
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(600),
              fs::canonical(root_ / "/data/real-home"));

    // Unknown users and missing homes fall back to mobile's.
    const auto fallback = root_ / "/private/var/mobile";
    LogCapture log;
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(601), fallback);
    EXPECT_FALSE(log.contains("Failed to getpwuid"));
    EXPECT_TRUE(log.contains("Failed to get home dir using getpwuid for uid: 601"));
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(4242), fallback);
    EXPECT_TRUE(log.contains("Failed to getpwuid for uid: 4242"));
    EXPECT_TRUE(log.contains("Failed to get home dir using getpwuid for uid: 4242"));
}

TEST_F(FsTest, ExistenceDoesNotFollowLinks) {
    auto dir = root_ / "/private/var/containers";
    fs::create_directories(dir);
    fs::create_symlink(dir / "gone", dir / "dangling");
    EXPECT_TRUE(manager_.itemExistsAtURL(dir / "dangling"));
    EXPECT_FALSE(manager_.itemDoesNotExistAtURL(dir / "dangling"));
    EXPECT_TRUE(manager_.itemDoesNotExistAtURL(dir / "gone"));
    EXPECT_FALSE(manager_.itemExistsAtURL({}));
}

} // namespace
} // namespace quarn::test
