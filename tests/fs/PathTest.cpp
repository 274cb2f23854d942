// Containment of paths, making directories, temporary directories, homes.
#include "FsTestSupport.h"

#include <regex>

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
};

TEST_F(ContainmentTest, ResolvesInsideTheBaseAndRefusesEverythingElse) {
    // ".." is refused before the file system is asked, though this one stays inside.
    EXPECT_FALSE(check(base() / "sub" / ".." / "file"));
    for (auto call : {EnvCall::Readlink, EnvCall::Realpath, EnvCall::Stat, EnvCall::Open})
        EXPECT_EQ(env_->count(call), 0u) << envCallName(call);

    const auto b = base();
    const auto r = real(b);
    fs::create_directories(b.string() + "Y");
    const std::string longTarget(1024, 'a');
    const auto under = [](const fs::path& p, const char* rel) { return *rel ? p / rel : p; };
    // Each row's link, if any, is made just before it is checked; `resolved`
    // is below the real base, null for a refusal. A message is checked only
    // where it alone tells which refusal ran.
    const char* const cases[][4] = {
        {"file", nullptr, "file", ""},
        {"", nullptr, "", ""},
        {"../../../other", nullptr, nullptr, "does not contain base path"},
        // A sibling whose name extends the base's passes the string check only.
        {"../XY", nullptr, nullptr, ""},
        {"sub/out", "../../other", nullptr, "as it is points outside or to the base"},
        {"sub/up", "../file", "file", ""},
        {"abs", "/etc", nullptr, "as absolute symlinks are not allowed"},
        {"sub/home", "..", "", ""}, // the base itself: not outside
        {"parent", "..", nullptr, ""},
        // The depth check sees one hop: later hops and parent links are
        // caught by comparing real paths.
        {"hop", "../../../other", nullptr, ""},
        {"start", "hop", nullptr, ""},
        {"hop/x", nullptr, nullptr, ""},
        {"alias", "sub", "sub", ""},
        {"chain", "alias/../file", "file", ""},
        {"alias/new", nullptr, "sub/new", ""},
        // Missing components are appended unresolved, but a dangling link
        // would later be followed to wherever it points.
        {"sub/new/deeper", nullptr, "sub/new/deeper", ""},
        {"gone", "../../../elsewhere", nullptr, ""},
        {"dangling", "gone", nullptr, ""},
        {"dangling/child", nullptr, nullptr, ""},
        // A file where a directory is needed is not "missing".
        {"file/x", nullptr, nullptr, ""},
        {"long", longTarget.c_str(), nullptr, "Readlink failed: File name too long"}, // not cut
    };
    for (const auto& [rel, link, resolved, logged] : cases) {
        const auto at = under(b, rel).lexically_normal();
        SCOPED_TRACE(at);
        if (link)
            fs::create_symlink(link, at);
        log_.clear();
        EXPECT_EQ(check(at), resolved ? std::optional(under(r, resolved)) : std::nullopt);
        EXPECT_TRUE(!*logged || log_.contains(logged)) << log_.all();
    }

    env_->failCall(EnvCall::Readlink, 1, EACCES);
    EXPECT_FALSE(check(b / "file"));
    EXPECT_FALSE(manager_.realPathForURL(b / "none" / "a", b / "none"));
    EXPECT_FALSE(manager_._realPathForURL(b / "file" / "x", true));

    // The depth walk fails as soon as it falls below where it started.
    const std::pair<const char*, std::optional<int>> walks[] = {
        {"/a/b", 2}, {"a/./b//c/", 5}, {"a/../b", 3}, {"../a/b", {}}, {"a/../../b/c", {}}};
    for (auto [target, depth] : walks)
        EXPECT_EQ(manager_._validateSymlink(target, target[0] == '/' ? 0 : 2), depth) << target;
}

TEST_F(ContainmentTest, ThePrivatePrefixIsDroppedBelowTheRoot) {
    const auto deviceStyleBase = root_ / "/var/containers/Data/X";
    fs::create_symlink("private/var", root_ / "/var"); // as on the device
    EXPECT_EQ(manager_.realPathForURL(base() / "a", deviceStyleBase), real(base()) / "a");
    EXPECT_EQ(manager_.realPathForURL(deviceStyleBase / "file", base()), real(base() / "file"));
    EXPECT_FALSE(manager_.realPathForURL(base(), "/"));
}

class CreateDirectoryTest : public FsTest {
protected:
    void SetUp() override {
        previousUmask_ = ::umask(0);
        fs::create_directories(base());
        ::chmod(base().c_str(), 0755);
    }
    void TearDown() override { ::umask(previousUmask_); }
    fs::path base() { return root_ / "/private/var/containers"; }

    mode_t previousUmask_ = 0;
};

TEST_F(CreateDirectoryTest, EveryCreatedLevelGetsTheModeButOnlyTheLeafOwnerAndClassEvenIfThere) {
    using Q = QRNFileManager;
    const auto b = base();
    ASSERT_TRUE(manager_.createDirectoryAtURL(b / "a" / "b" / "c", true, 0711, kMobileUID, 3));
    // The short forms leave the class or the owner alone.
    ASSERT_TRUE(manager_.createDirectoryAtURL(b / "owned", false, 0755, Q::Owner{kMobileUID}));
    ASSERT_TRUE(manager_.createDirectoryAtURL(b / "classed", false, 0755, Q::ProtectionClass{4}));
    ASSERT_TRUE(manager_.createDirectoryAtURL(b / "plain", false, 0700));
    const std::pair<fs::path, const char*> made[] = {
        {b, "755 0:0 -"}, // already there: keeps its own mode
        {b / "a", "711 0:0 -"},
        {b / "a" / "b", "711 0:0 -"},
        {b / "a" / "b" / "c", "711 501:501 3"}, // owner number used as group too
        {b / "owned", "755 501:501 -"},
        {b / "classed", "755 0:0 4"},
        {b / "plain", "700 0:0 -"}};
    for (const auto& [p, expected] : made)
        EXPECT_EQ(describe(p), expected) << p;

    // An existing directory is success and still gets class and owner.
    auto dir = b / "plain";
    for (bool intermediate : {true, false}) {
        ASSERT_TRUE(manager_.createDirectoryAtURL(dir, intermediate, 0755, kMobileUID, 2));
        EXPECT_EQ(describe(dir), "700 501:501 2") << "mode of an existing level is left";
        ::chown(dir.c_str(), 0, 0);
    }

    // Already owned: no chown at all; only the group differs: chowned.
    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, kMobileUID), 0);
    const auto chowns = env_->count(EnvCall::Chown);
    ASSERT_TRUE(manager_.createDirectoryAtURL(dir, true, 0755, kMobileUID, -1));
    EXPECT_EQ(env_->count(EnvCall::Chown), chowns);
    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, 0), 0);
    ASSERT_TRUE(manager_.createDirectoryAtURL(dir, true, 0755, kMobileUID, -1));
    EXPECT_EQ(lstatOf(dir).st_gid, kMobileUID);
}

TEST_F(CreateDirectoryTest, FailuresCarryTheErrnoAndTheirMessage) {
    const auto noParent = base() / "no" / "leaf";
    EXPECT_TRUE(failedWith(manager_.createDirectoryAtURL(noParent, false, 0755), ENOENT,
                           "mkdir of " + noParent.string() + " failed: No such file or directory"));

    // A file, or a link to a directory, where a level should be: neither
    // form takes it for a directory, and nothing is given owner or class.
    writeFile(base() / "file", "x");
    fs::create_directories(base() / "target");
    fs::create_directory_symlink(base() / "target", base() / "link");
    auto underFile = manager_.createDirectoryAtURL(base() / "file" / "leaf", true, 0755);
    ASSERT_TRUE(failedWith(underFile, ENOTDIR));
    EXPECT_EQ(underFile.error().message.rfind("mkpath of ", 0), 0u);
    for (auto [at, intermediate] : {std::pair{base() / "file", false}, {base() / "link", true}})
        EXPECT_TRUE(failedWith(manager_.createDirectoryAtURL(at, intermediate, 0755, kMobileUID, 1),
                               ENOTDIR))
            << at;
    EXPECT_EQ(describe(base() / "file").substr(4), "0:0 -");
    EXPECT_EQ(describe(base() / "target").substr(4), "0:0 -");

    // The class is set before the owner; a failure of either is reported.
    const auto c = base() / "c";
    env_->failCall(EnvCall::SetXattr, 1, EIO);
    EXPECT_TRUE(
        failedWith(manager_.createDirectoryAtURL(c, false, 0755, kMobileUID, 3), EIO,
                   "Failed to setclass(3) on directory " + c.string() + ": Input/output error"));
    EXPECT_EQ(lstatOf(c).st_uid, 0u);
    env_->failCall(EnvCall::Chown, 1, EPERM);
    EXPECT_TRUE(failedWith(manager_.createDirectoryAtURL(c, false, 0755, kMobileUID, -1), EPERM,
                           "Failed to chown(501,501) " + c.string() + ": Operation not permitted"));

    env_->failCall(EnvCall::Mkdir, 2, ENOSPC);
    EXPECT_TRUE(
        failedWith(manager_.createDirectoryAtURL(base() / "x" / "y" / "z", true, 0755), ENOSPC));
    EXPECT_TRUE(existsNoFollow(base() / "x"));
    EXPECT_FALSE(existsNoFollow(base() / "x" / "y"));
}

TEST_F(CreateDirectoryTest, OpenedDirectoryIsTheMadeOneAndTakesOnlyChildrenBelowIt) {
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
    EXPECT_EQ(describe(top / "a"), "711 0:0 -");
    EXPECT_EQ(describe(top / "a" / "b"), "711 501:501 3");
    ASSERT_TRUE(manager_.createAndOpenDirectoryInDirectory(*deep, top / "a" / "b", "c", 0755,
                                                           kMobileUID, 2));
    EXPECT_EQ(xattrOf(top / "a" / "b" / "c"), "2");
    // Made again: success, the class is set again.
    ASSERT_TRUE(
        manager_.createAndOpenDirectoryInDirectory(*opened, top, "a/b/c", 0755, kMobileUID, 4));
    EXPECT_EQ(xattrOf(top / "a" / "b" / "c"), "4");

    // Relative creation stays below its directory and follows no link.
    fs::create_directories(base() / "outside");
    fs::create_directory_symlink(base() / "outside", top / "link");
    const std::pair<const char*, int> refused[] = {
        {"../escaped", EINVAL}, {"/abs", EINVAL},  {"", EINVAL},       {"a/../b", EINVAL},
        {".", EINVAL},          {"link", ENOTDIR}, {"link/x", ENOTDIR}};
    for (auto [relative, err] : refused) {
        auto made =
            manager_.createAndOpenDirectoryInDirectory(*opened, top, relative, 0755, kMobileUID, 1);
        EXPECT_TRUE(failedWith(made, err)) << relative;
    }
    auto viaLink = manager_.createAndOpenDirectoryInDirectory(*opened, top, "link/x", 0755, 0, -1);
    ASSERT_TRUE(failedWith(viaLink, ENOTDIR));
    EXPECT_EQ(viaLink.error().message.rfind("mkpath of " + (top / "link/x").string(), 0), 0u);
    EXPECT_FALSE(existsNoFollow(base() / "escaped"));
    EXPECT_FALSE(existsNoFollow(base() / "outside" / "x"));
    EXPECT_EQ(describe(base() / "outside").substr(4), "0:0 -");
}

TEST_F(FsTest, TemporaryDirectoriesAreUniqueAndPrivateInTheDirectory) {
    auto in = root_ / "/tmp";
    fs::create_directories(in);
    auto first = manager_.createTemporaryDirectoryInDirectoryURL(in);
    auto named = manager_.createTemporaryDirectoryInDirectoryURL(in, "Staging-");
    auto second = manager_.createTemporaryDirectoryInDirectoryURL(in);
    ASSERT_TRUE(first && second && named);
    EXPECT_NE(*first, *second);
    EXPECT_TRUE(std::regex_match(first->string(), std::regex(in.string() + "/temp\\.\\w{6}")));
    EXPECT_TRUE(std::regex_match(named->string(), std::regex(in.string() + "/Staging-\\w{6}")));
    EXPECT_EQ(lstatOf(*first).st_mode & 07777, 0700u);
    EXPECT_TRUE(
        failedWith(manager_.createTemporaryDirectoryInDirectoryURL(root_ / "/nowhere"), ENOENT,
                   "Failed to create temp dir at path " +
                       (root_ / "/nowhere/temp.XXXXXX").string() + " : No such file or directory"));
    // A prefix must not lead out of the directory.
    EXPECT_TRUE(failedWith(manager_.createTemporaryDirectoryInDirectoryURL(in, "../x"), EINVAL));
}

TEST_F(FsTest, HomeDirectoryIsTheRealPathOfTheAccountsHomeOrMobilesAndExistenceIsOfLinks) {
    // A home reached through a link resolves to where it really is.
    fs::create_directories(root_ / "/data/real-home");
    fs::create_directory_symlink(root_ / "/data/real-home", root_ / "/private/var/linked");
    root_.writeFile("/etc/passwd", "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                   "linked:x:600:600::/private/var/linked:/bin/sh\n"
                                   "ghost:x:601:601::/private/var/ghost:/bin/sh\n");
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(600),
              fs::canonical(root_ / "/data/real-home"));
    // Unknown users and missing homes fall back to mobile's.
    for (uid_t uid : {601u, 4242u})
        EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(uid), root_ / "/private/var/mobile");

    // Existence does not follow links.
    auto dir = root_ / "/private/var";
    fs::create_symlink(dir / "gone", dir / "dangling");
    EXPECT_TRUE(manager_.itemExistsAtURL(dir / "dangling"));
    EXPECT_FALSE(manager_.itemDoesNotExistAtURL(dir / "dangling"));
    EXPECT_TRUE(manager_.itemDoesNotExistAtURL(dir / "gone"));
    EXPECT_FALSE(manager_.itemExistsAtURL({}));
}

} // namespace
} // namespace quarn::test
