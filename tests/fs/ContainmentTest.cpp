#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

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

    fs::path base() { return root_ / "/private/var/containers/Data/X"; }
    std::optional<fs::path> check(const fs::path& p) {
        return QRNFileManager::defaultManager().realPathForURL(p, base());
    }
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
    auto& manager = QRNFileManager::defaultManager();
    const auto deviceStyleBase = root_ / "/var/containers/Data/X";
    EXPECT_FALSE(manager.realPathForURL(base() / "a", deviceStyleBase));
    EXPECT_TRUE(log_.contains("for base path " + deviceStyleBase.string() + " "));
    link("private/var", root_ / "/var"); // as on the device
    EXPECT_EQ(manager.realPathForURL(base() / "a", deviceStyleBase), real(base()) / "a");
    EXPECT_EQ(manager.realPathForURL(deviceStyleBase / "file", base()), real(base() / "file"));
    EXPECT_FALSE(manager.realPathForURL(base(), "/"));
    EXPECT_TRUE(log_.contains("because real component counts don't make sense"));
}

TEST_F(ContainmentTest, DotDotIsRejectedBeforeAnyFileSystemAccess) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager watched(root_.context(), env);
    EXPECT_FALSE(watched.realPathForURL(base() / "sub" / ".." / "file", base())); // inside
    EXPECT_TRUE(log_.contains("contains '..' paths, which are invalid"));
    for (auto call : {EnvCall::Readlink, EnvCall::Realpath, EnvCall::Stat, EnvCall::Open}) {
        EXPECT_EQ(env->count(call), 0u) << envCallName(call);
    }
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
}

TEST_F(ContainmentTest, MissingComponentsAreAppendedUnresolved) {
    EXPECT_EQ(check(base() / "sub" / "new" / "deeper"), real(base() / "sub") / "new" / "deeper");
    EXPECT_FALSE(
        QRNFileManager::defaultManager().realPathForURL(base() / "gone" / "a", base() / "gone"));
    EXPECT_TRUE(log_.contains("Failed to retrieve realpath for base path"));
    // A dangling link would later be followed to wherever it points.
    link("../../../elsewhere", base() / "hop");
    link("hop", base() / "dangling");
    EXPECT_FALSE(check(base() / "dangling"));
    EXPECT_FALSE(check(base() / "dangling" / "child"));
    // A file where a directory is needed is not "missing".
    EXPECT_FALSE(check(base() / "file" / "x"));
    EXPECT_TRUE(log_.contains("Readlink failed: Not a directory"));
    EXPECT_FALSE(QRNFileManager::defaultManager()._realPathForURL(base() / "file" / "x", true));
    EXPECT_TRUE(log_.contains("Failed to realpath " + (base() / "file" / "x").string() +
                              " : Not a directory"));
}

TEST_F(ContainmentTest, ReadlinkFailuresOtherThanNotALinkReject) {
    auto env = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    env->failCall(EnvCall::Readlink, 1, EACCES);
    EXPECT_FALSE(QRNFileManager(root_.context(), env).realPathForURL(base() / "file", base()));
    EXPECT_TRUE(log_.contains("Readlink failed: Permission denied"));
    link(std::string(1024, 'a'), base() / "long"); // refused, not cut
    EXPECT_FALSE(check(base() / "long"));
    EXPECT_TRUE(log_.contains("Readlink failed: File name too long"));
}

TEST(DepthWalkTest, FailsAsSoonAsTheDepthFallsBelowTheStart) {
    TempRoot root;
    auto& manager = QRNFileManager::defaultManager();
    EXPECT_EQ(manager._validateSymlink("/a/b", 0), 2);
    EXPECT_EQ(manager._validateSymlink("a/./b//c/", 2), 5);
    EXPECT_EQ(manager._validateSymlink("a/../b", 2), 3);
    EXPECT_FALSE(manager._validateSymlink("../a/b", 2)) << "dips below before coming back";
    EXPECT_FALSE(manager._validateSymlink("a/../../b/c", 2));
}

} // namespace
} // namespace quarn::test
