// ACLs, ownership and data protection classes of container trees.
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNError.h"

#include "FsTestSupport.h"

namespace quarn::test {
namespace {

// Everything below the top: the group's full rights, nothing for the mode bits.
constexpr const char* kFullBelowTop = "u::---,g::---,g:1501:rwx,m::rwx,o::---";
// The top lets the group add entries but not list or read them.
constexpr const char* kTopAccess = "u::rwx,g::r-x,g:1501:-wx,m::rwx,o::r-x";

class ACLTest : public FsTest {
protected:
    void SetUp() override {
        fs::create_directories(container() / "Library" / "Caches");
        ::chmod(container().c_str(), 0755);
        item(container() / ".com.orvex.quarn_store.metadata.plist", 0600);
        item(container() / "Library" / "tool", 0755);
        ::mkfifo((container() / "Library" / "pipe").c_str(), 0644);
        item(root_ / "/outside", 0600);
        fs::create_symlink(root_ / "/outside", container() / "Library" / "link");
    }
    void item(const fs::path& p, mode_t mode) {
        writeFile(p, "x");
        ::chmod(p.c_str(), mode);
    }
    fs::path container() { return root_ / "/private/var/containers/Data/System/C1"; }
};

TEST_F(ACLTest, TopLevelGrantsAddingOnlyAndTheTreeBelowGetsFullRights) {
    // Applying twice replaces rather than accumulates.
    for (int i = 0; i < 2; ++i)
        ASSERT_TRUE(manager_.setTopLevelSystemContainerACLAtURL(container()));
    EXPECT_EQ(aclText(container()), kTopAccess);
    EXPECT_EQ(aclText(container(), ACL_TYPE_DEFAULT), "u::rwx,g::r-x,g:1501:rwx,m::rwx,o::r-x");
    // A new item inherits.
    fs::create_directory(container() / "Documents");
    EXPECT_NE(aclText(container() / "Documents").find("g:1501:rwx"), std::string::npos);

    ASSERT_TRUE(manager_.standardizeACLsForSystemContainerAtURL(container()));
    EXPECT_EQ(aclText(container()), kTopAccess);
    EXPECT_EQ(lstatOf(container()).st_uid, 0u);
    for (auto dir : {"Library", "Library/Caches"})
        EXPECT_EQ(aclText(container() / dir, ACL_TYPE_DEFAULT), kFullBelowTop) << dir;
    // Only the mask shows in the mode.
    for (auto item : {"Library", "Library/Caches", "Library/tool", "Library/pipe"}) {
        EXPECT_EQ(aclText(container() / item), kFullBelowTop) << item;
        EXPECT_EQ(describe(container() / item).substr(0, 15), "70 65534:65534 ") << item;
    }
    EXPECT_EQ(lstatOf(container() / "Library" / "link").st_uid, 65534u);
    // The metadata file stays root's; the link was not followed.
    for (auto item : {container() / ".com.orvex.quarn_store.metadata.plist", root_ / "/outside"}) {
        EXPECT_EQ(aclText(item), "u::rw-,g::---,o::---") << item;
        EXPECT_EQ(describe(item), "600 0:0 -") << item;
    }

    // An ordinary tree gets the full list at its top too.
    const auto plain = root_ / "/plain";
    fs::create_directory(plain);
    ASSERT_TRUE(manager_.standardizeACLsAtURL(plain, false));
    EXPECT_EQ(aclText(plain), kFullBelowTop);
    EXPECT_EQ(lstatOf(plain).st_uid, 65534u);
}

TEST_F(ACLTest, AllSystemContainersOfADirectoryAndAMissingGroup) {
    auto parent = container().parent_path();
    fs::create_directories(parent / "C2" / "Library");
    EXPECT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(parent / "missing"));

    // Without the group nothing is touched, and every container is still tried.
    const auto groups = readFile(root_ / "/etc/group");
    root_.writeFile("/etc/group", "wheel:x:0:\n");
    for (bool wholeTree : {false, true}) {
        auto set = wholeTree ? manager_.standardizeACLsAtURL(container(), true)
                             : manager_.setTopLevelSystemContainerACLAtURL(container());
        ASSERT_FALSE(set) << wholeTree;
        EXPECT_TRUE(set.error().isQRN(kQRNErrorSetACLFailed)) << wholeTree;
    }
    EXPECT_TRUE(log_.contains("group lookup failed"));
    EXPECT_FALSE(manager_.standardizeAllSystemContainerACLsAtURL(parent));
    EXPECT_EQ(log_.count("Failed to set system container ACL at"), 2u);
    EXPECT_EQ(aclText(container()), "u::rwx,g::r-x,o::r-x");

    root_.writeFile("/etc/group", groups);
    ASSERT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(parent));
    EXPECT_TRUE(log_.contains("Potential containers requiring ACL migration"));
    for (auto c : {container(), parent / "C2"}) {
        EXPECT_EQ(aclText(c), kTopAccess) << c;
        EXPECT_EQ(aclText(c / "Library", ACL_TYPE_DEFAULT), kFullBelowTop) << c;
    }
}

struct OwnedItem {
    const char* name;
    bool directory;
    mode_t made;
    const char* forced;
};
// Every item of the tree, with the mode it is made with and the one forced on it.
const OwnedItem kOwnedItems[] = {{"", true, 0700, "755"},
                                 {"sub", true, 0700, "755"},
                                 {"sub/deeper", true, 0555, "755"},
                                 {"plain", false, 0600, "644"},
                                 {"sub/tool", false, 0700, "755"},
                                 {"sub/group-exec", false, 0610, "755"},
                                 {"sub/setuid", false, 04644, "644"}};

class OwnershipTest : public FsTest {
protected:
    void SetUp() override {
        for (const auto& item : kOwnedItems) {
            if (item.directory)
                fs::create_directories(tree() / item.name);
            else
                writeFile(tree() / item.name, "x");
            ::chmod((tree() / item.name).c_str(), item.made);
        }
        for (auto p : {metadata(), root_ / "/outside"}) {
            writeFile(p, "x");
            ::chmod(p.c_str(), 0600);
        }
        fs::create_symlink(root_ / "/outside", tree() / "sub" / "link");
    }
    fs::path tree() { return root_ / "/private/var/mobile/Containers/Data/A"; }
    fs::path metadata() { return tree() / ".com.orvex.quarn_store.metadata.plist"; }
};

TEST_F(OwnershipTest, OwnerAndModeAreForcedOverTheTreeChowningOnlyWhatDiffers) {
    ASSERT_TRUE(manager_.standardizeOwnershipAtURL(tree(), 0, 0));
    EXPECT_EQ(env_->count(EnvCall::Chown), 0u) << "all already owned";
    EXPECT_EQ(lstatOf(tree() / "plain").st_mode & 07777, 0644u) << "the mode is still set";

    // Failures of one entry do not stop the rest.
    env_->failCall(EnvCall::Chown, 2, EIO);
    env_->failCall(EnvCall::Chmod, 3, EIO);
    ASSERT_TRUE(manager_.standardizeOwnershipAtURL(tree(), kMobileUID, kMobileUID));
    EXPECT_EQ(log_.count("Could not chown"), 1u) << log_.all();
    EXPECT_EQ(log_.count("Could not chmod"), 1u) << log_.all();
    int owned = lstatOf(tree() / "sub" / "link").st_uid == kMobileUID;
    for (const auto& item : kOwnedItems)
        owned += lstatOf(tree() / item.name).st_uid == kMobileUID;
    EXPECT_EQ(owned, 7);

    env_->clearFailures();
    ASSERT_TRUE(manager_.standardizeOwnershipAtURL(tree(), kMobileUID, kMobileUID));
    for (const auto& item : kOwnedItems)
        EXPECT_EQ(describe(tree() / item.name), std::string(item.forced) + " 501:501 -")
            << item.name;
    EXPECT_EQ(lstatOf(tree() / "sub" / "link").st_uid, kMobileUID) << "the link itself";
    // The metadata file stays root's; the link's target is not touched.
    for (auto p : {metadata(), root_ / "/outside"})
        EXPECT_EQ(describe(p), "600 0:0 -") << p;

    EXPECT_TRUE(failedWith(
        manager_.standardizeOwnershipAtURL(tree() / "missing", kMobileUID, kMobileUID), ENOENT));
}

TEST_F(FsTest, ProtectionClassesAreOnlyOnFilesAndDirectoriesAndClassOneHoldsWhileLocked) {
    const auto dir = root_ / "/private/var/containers/Data/A", file = dir / "file";
    const auto classOf = [&](const fs::path& p) {
        return *manager_.dataProtectionClassOfItemAtURL(p);
    };
    fs::create_directories(dir);
    writeFile(file, "data");
    fs::create_symlink(file, dir / "link");
    ::mkfifo((dir / "fifo").c_str(), 0600);
    ASSERT_EQ(::mknod((dir / "sock").c_str(), S_IFSOCK | 0600, 0), 0);
    for (auto item : {dir / "link", dir / "fifo", dir / "sock"}) {
        EXPECT_TRUE(failedWith(manager_.dataProtectionClassOfItemAtURL(item), EBADF)) << item;
        EXPECT_TRUE(failedWith(manager_.setDataProtectionClassOfItemAtURL(item, 2), EBADF)) << item;
    }
    EXPECT_EQ(classOf(file), 0) << "none set, the link's target not touched";
    EXPECT_TRUE(failedWith(manager_.setDataProtectionClassOfItemAtURL(dir / "missing", 2), ENOENT));

    for (auto item : {dir, file}) {
        ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(item, 2));
        EXPECT_EQ(classOf(item), 2);
        EXPECT_EQ(xattrOf(item), "2");
    }
    int seen = -1;
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file, 4, [&](int current) {
        seen = current;
        return false;
    }));
    EXPECT_EQ(seen, 2);
    EXPECT_EQ(classOf(file), 2) << "declined: nothing changed";
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(
        file, 1, [](int current) { return current < 4; }));
    EXPECT_EQ(classOf(file), 1);

    // While the device is locked a class-one item keeps its class; others change.
    auto run = Paths(root_.path()).runDirectory();
    fs::create_directories(run);
    writeFile(run / "lockstate", "1");
    EXPECT_TRUE(failedWith(manager_.setDataProtectionClassOfItemAtURL(file, 3), EPERM));
    EXPECT_EQ(classOf(file), 1);
    EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file, 1)) << "not a change";
    EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(dir, 3));
    EXPECT_EQ(classOf(dir), 3);
    writeFile(run / "lockstate", "0");
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file, 3));
    EXPECT_EQ(classOf(file), 3);
}

} // namespace
} // namespace quarn::test
