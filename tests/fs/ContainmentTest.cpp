#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <string>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class ContainmentTest : public TempRootTest {
protected:
    void SetUp() override {
        fs::create_directories(base() / "sub");
        fs::create_directories(root_ / "/private/var/other");
        writeFile(base() / "file", "inside");
    }

    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
    fs::path base() { return root_ / "/private/var/containers/Data/X"; }
    fs::path real(const fs::path& p) { return fs::canonical(p); }
    void link(const std::string& target, const fs::path& at) { fs::create_symlink(target, at); }

    LogCapture log_;
};

TEST_F(ContainmentTest, PlainItemsInsideAndOutside) {
    EXPECT_EQ(manager().realPathForURL(base() / "file", base()), real(base() / "file"));
    EXPECT_EQ(manager().realPathForURL(base(), base()), real(base())) << "the base itself";

    EXPECT_FALSE(manager().realPathForURL(root_ / "/private/var/other", base()));
    EXPECT_TRUE(log_.contains("does not contain base path"));

    // A sibling whose name extends the base's passes the string check only.
    fs::create_directories(base().string() + "Y");
    EXPECT_FALSE(manager().realPathForURL(base().string() + "Y", base()));
    EXPECT_TRUE(log_.contains("because components diverge at X != XY")) << log_.all();

    EXPECT_FALSE(manager().realPathForURL(fs::path(), base()));
    EXPECT_TRUE(log_.contains("were nil"));
}

TEST_F(ContainmentTest, PrivatePrefixIsDroppedBelowTheRoot) {
    const auto deviceStyleBase = root_ / "/var/containers/Data/X";
    // Without "<root>/var" the strings agree but the base cannot be resolved.
    EXPECT_FALSE(manager().realPathForURL(base() / "a", deviceStyleBase));
    EXPECT_FALSE(log_.contains("does not contain base path")) << log_.all();
    EXPECT_TRUE(log_.contains("Failed to retrieve realpath for base path " +
                              deviceStyleBase.string() + " "));

    // As on the device, where /var is a link into /private.
    link("private/var", root_ / "/var");
    EXPECT_EQ(manager().realPathForURL(base() / "a", deviceStyleBase), real(base()) / "a");
    EXPECT_EQ(manager().realPathForURL(deviceStyleBase / "file", base()), real(base() / "file"));
}

TEST_F(ContainmentTest, DotDotIsRejectedBeforeAnyFileSystemAccess) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager watched(root_.context(), env);
    // Would resolve to base/file, inside.
    EXPECT_FALSE(watched.realPathForURL(base() / "sub" / ".." / "file", base()));
    EXPECT_TRUE(log_.contains("contains '..' paths, which are invalid"));
    for (auto call : {EnvCall::Readlink, EnvCall::Realpath, EnvCall::Stat, EnvCall::Open}) {
        EXPECT_EQ(env->count(call), 0u) << envCallName(call);
    }
}

TEST_F(ContainmentTest, LinkTargetsMustStayBelowTheBase) {
    link("../../other", base() / "sub" / "out");
    EXPECT_FALSE(manager().realPathForURL(base() / "sub" / "out", base()));
    EXPECT_TRUE(log_.contains("as it is points outside or to the base"));

    link("../file", base() / "sub" / "up");
    EXPECT_EQ(manager().realPathForURL(base() / "sub" / "up", base()), real(base() / "file"));

    link("/etc", base() / "abs");
    EXPECT_FALSE(manager().realPathForURL(base() / "abs", base()));
    EXPECT_TRUE(log_.contains("as absolute symlinks are not allowed"));

    // Back to the base itself is not below it, but not outside either.
    link("..", base() / "sub" / "home");
    EXPECT_EQ(manager().realPathForURL(base() / "sub" / "home", base()), real(base()));
    link("..", base() / "parent");
    EXPECT_FALSE(manager().realPathForURL(base() / "parent", base()));
}

TEST_F(ContainmentTest, EveryHopOfAChainAndEveryParentLinkIsChecked) {
    link("hop", base() / "start");
    link("../../../other", base() / "hop");
    EXPECT_FALSE(manager().realPathForURL(base() / "start", base()));
    EXPECT_TRUE(log_.contains("Rejecting " + (base() / "start").string() + " with base"))
        << log_.all();

    link("sub", base() / "alias");
    link("alias/../file", base() / "chain"); // ".." inside the target is walked, not refused
    EXPECT_EQ(manager().realPathForURL(base() / "chain", base()), real(base() / "file"));

    link("../../../other", base() / "escape");
    EXPECT_FALSE(manager().realPathForURL(base() / "escape" / "x", base()));
    EXPECT_EQ(manager().realPathForURL(base() / "alias" / "new", base()),
              real(base() / "sub") / "new");
}

TEST_F(ContainmentTest, MissingComponentsAreAppendedUnresolved) {
    EXPECT_EQ(manager().realPathForURL(base() / "sub" / "new" / "deeper", base()),
              real(base() / "sub") / "new" / "deeper");
    EXPECT_FALSE(manager().realPathForURL(base() / "gone" / "x", base() / "gone"));
    EXPECT_TRUE(log_.contains("Failed to retrieve realpath for base path"));

    // A dangling link would later be followed to wherever it points.
    link("../../../elsewhere", base() / "hop");
    link("hop", base() / "dangling");
    EXPECT_FALSE(manager().realPathForURL(base() / "dangling", base()));
    EXPECT_FALSE(manager().realPathForURL(base() / "dangling" / "child", base()));

    // A file where a directory is needed is not "missing".
    EXPECT_FALSE(manager().realPathForURL(base() / "file" / "x", base()));
    EXPECT_TRUE(log_.contains("Readlink failed: Not a directory"));
    EXPECT_FALSE(manager()._realPathForURL(base() / "file" / "x", true));
    EXPECT_TRUE(log_.contains("Failed to realpath " + (base() / "file" / "x").string() +
                              " : Not a directory"));
}

TEST_F(ContainmentTest, ReadlinkFailuresOtherThanNotALinkReject) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager faulty(root_.context(), env);
    env->failCall(EnvCall::Readlink, 1, EACCES);
    EXPECT_FALSE(faulty.realPathForURL(base() / "file", base()));
    EXPECT_TRUE(log_.contains("Readlink failed: Permission denied"));

    // A target that does not fit the buffer is refused, not cut.
    link(std::string(1024, 'a'), base() / "long");
    EXPECT_FALSE(manager().realPathForURL(base() / "long", base()));
    EXPECT_TRUE(log_.contains("Readlink failed: File name too long"));
}

TEST_F(ContainmentTest, RootAsBaseHasTooFewComponents) {
    EXPECT_FALSE(manager().realPathForURL(base(), "/"));
    EXPECT_TRUE(log_.contains("because real component counts don't make sense"));
}

TEST(DepthWalkTest, FailsAsSoonAsTheDepthFallsBelowTheStart) {
    TempRoot root;
    auto& manager = QRNFileManager::defaultManager();
    EXPECT_EQ(manager._validateSymlink("/a/b", 0), 2);
    EXPECT_EQ(manager._validateSymlink("a/./b//c/", 2), 5);
    EXPECT_EQ(manager._validateSymlink("a/../b", 2), 3);
    EXPECT_EQ(manager._validateSymlink("", 4), 4);
    EXPECT_FALSE(manager._validateSymlink("../a/b", 2)) << "dips below before coming back";
    EXPECT_FALSE(manager._validateSymlink("a/../../b/c", 2));
}

} // namespace
} // namespace quarn::test
