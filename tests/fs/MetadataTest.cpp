// ACLs, ownership and data protection classes of container trees.
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNError.h"

#include "FsTestSupport.h"

#include <acl/libacl.h>
#include <sys/acl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <set>
#include <sstream>

namespace quarn::test {
namespace {

using Entries = std::set<std::string>;

// "user::rwx", "group:1501:-wx", ... read back with libacl.
Entries entriesOf(const fs::path& path, acl_type_t type = ACL_TYPE_ACCESS) {
    acl_t acl = acl_get_file(path.c_str(), type);
    char* text = acl ? acl_to_any_text(acl, nullptr, ',', TEXT_NUMERIC_IDS) : nullptr;
    if (!text) {
        ADD_FAILURE() << "cannot read the ACL of " << path;
        return {};
    }
    Entries entries;
    std::stringstream list(text);
    for (std::string entry; std::getline(list, entry, ',');)
        entries.insert(entry);
    acl_free(text);
    acl_free(acl);
    return entries;
}

const Entries kFullBelowTop = {"user::---", "group::---", "other::---", "group:1501:rwx",
                               "mask::rwx"};
const Entries kTopAccess = {"user::rwx", "group::r-x", "other::r-x", "group:1501:-wx", "mask::rwx"};

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

TEST_F(ACLTest, TopLevelGrantsAddingOnlyAndPassesFullRightsDown) {
    // Applying twice replaces rather than accumulates.
    for (int i = 0; i < 2; ++i) {
        ASSERT_TRUE(manager_.setTopLevelSystemContainerACLAtURL(container()));
        EXPECT_EQ(entriesOf(container()), kTopAccess);
    }
    EXPECT_EQ(entriesOf(container(), ACL_TYPE_DEFAULT),
              (Entries{"user::rwx", "group::r-x", "other::r-x", "group:1501:rwx", "mask::rwx"}));
    EXPECT_EQ(lstatOf(container()).st_uid, 0u);
    // A new item inherits.
    fs::create_directory(container() / "Documents");
    EXPECT_EQ(entriesOf(container() / "Documents").count("group:1501:rwx"), 1u);
}

TEST_F(ACLTest, SystemContainerTreeIsStandardized) {
    ASSERT_TRUE(manager_.standardizeACLsForSystemContainerAtURL(container()));
    EXPECT_EQ(entriesOf(container()), kTopAccess);
    EXPECT_EQ(lstatOf(container()).st_uid, 0u);

    for (auto dir : {container() / "Library", container() / "Library" / "Caches"})
        EXPECT_EQ(entriesOf(dir, ACL_TYPE_DEFAULT), kFullBelowTop) << dir;
    for (auto item : {"Library", "Library/Caches", "Library/tool", "Library/pipe"})
        EXPECT_EQ(entriesOf(container() / item), kFullBelowTop) << item;
    for (auto item : {"Library", "Library/tool", "Library/link"}) {
        auto st = lstatOf(container() / item);
        EXPECT_EQ(st.st_uid, 65534u) << item;
        EXPECT_EQ(st.st_gid, 65534u) << item;
        if (!S_ISLNK(st.st_mode)) {
            EXPECT_EQ(st.st_mode & 07777, 070u) << item << ": only the mask shows in the mode";
        }
    }
    auto meta = container() / ".com.orvex.quarn_store.metadata.plist";
    EXPECT_EQ(entriesOf(meta), (Entries{"user::rw-", "group::---", "other::---"}));
    EXPECT_EQ(lstatOf(meta).st_uid, 0u);
    // The link was not followed.
    auto outside = lstatOf(root_ / "/outside");
    EXPECT_EQ(outside.st_uid, 0u);
    EXPECT_EQ(outside.st_mode & 07777, 0600u);
    EXPECT_EQ(entriesOf(root_ / "/outside").size(), 3u);
}

TEST_F(ACLTest, OrdinaryTreeGetsTheDirectoryListAtItsTopToo) {
    ASSERT_TRUE(manager_.standardizeACLsAtURL(container(), false));
    EXPECT_EQ(entriesOf(container()), kFullBelowTop);
    EXPECT_EQ(lstatOf(container()).st_uid, 65534u);
}

TEST_F(ACLTest, MissingGroupFailsWithTheACLCode) {
    root_.writeFile("/etc/group", "wheel:x:0:\n");
    LogCapture log;
    auto top = manager_.setTopLevelSystemContainerACLAtURL(container());
    ASSERT_FALSE(top);
    EXPECT_TRUE(top.error().isQRN(kQRNErrorSetACLFailed));
    EXPECT_TRUE(log.contains("group lookup failed"));
    auto tree = manager_.standardizeACLsAtURL(container(), true);
    ASSERT_FALSE(tree);
    EXPECT_TRUE(tree.error().isQRN(kQRNErrorSetACLFailed));
    EXPECT_EQ(entriesOf(container()).size(), 3u) << "nothing was touched";
}

TEST_F(ACLTest, AllSystemContainersOfADirectory) {
    auto parent = container().parent_path();
    fs::create_directories(parent / "C2" / "Library");
    EXPECT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(parent / "missing"));

    LogCapture log;
    ASSERT_TRUE(manager_.standardizeAllSystemContainerACLsAtURL(parent));
    EXPECT_TRUE(log.contains("Potential containers requiring ACL migration"));
    for (auto c : {container(), parent / "C2"}) {
        EXPECT_EQ(entriesOf(c), kTopAccess) << c;
        EXPECT_EQ(entriesOf(c / "Library", ACL_TYPE_DEFAULT), kFullBelowTop) << c;
    }
    // Every container is tried; the call still reports the failure.
    root_.writeFile("/etc/group", "wheel:x:0:\n");
    EXPECT_FALSE(manager_.standardizeAllSystemContainerACLsAtURL(parent));
    EXPECT_EQ(log.count("Failed to set system container ACL at"), 2u);
}

struct OwnedItem {
    const char* name;
    bool directory;
    mode_t made, forced;
};
// Every item of the tree, with the mode it is made with and the one forced on it.
const OwnedItem kOwnedItems[] = {{"", true, 0700, 0755},
                                 {"sub", true, 0700, 0755},
                                 {"sub/deeper", true, 0555, 0755},
                                 {"plain", false, 0600, 0644},
                                 {"sub/tool", false, 0700, 0755},
                                 {"sub/group-exec", false, 0610, 0755},
                                 {"sub/setuid", false, 04644, 0644}};

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

TEST_F(OwnershipTest, OwnerAndModeAreForcedOverTheTree) {
    ASSERT_TRUE(manager_.standardizeOwnershipAtURL(tree(), kMobileUID, kMobileUID));
    for (const auto& item : kOwnedItems) {
        auto st = lstatOf(tree() / item.name);
        EXPECT_EQ(st.st_mode & 07777, item.forced) << item.name;
        EXPECT_EQ(st.st_uid, kMobileUID) << item.name;
        EXPECT_EQ(st.st_gid, kMobileUID) << item.name;
    }
    EXPECT_EQ(lstatOf(tree() / "sub" / "link").st_uid, kMobileUID) << "the link itself";
    // The metadata file stays root's; the link's target is not touched.
    for (auto p : {metadata(), root_ / "/outside"}) {
        EXPECT_EQ(lstatOf(p).st_uid, 0u) << p;
        EXPECT_EQ(lstatOf(p).st_mode & 07777, 0600u) << p;
    }
}

TEST_F(OwnershipTest, EntriesAlreadyOwnedAreNotChownedAndAMissingRootFails) {
    ASSERT_TRUE(manager_.standardizeOwnershipAtURL(tree(), 0, 0));
    EXPECT_EQ(env_->count(EnvCall::Chown), 0u);
    EXPECT_EQ(lstatOf(tree() / "plain").st_mode & 07777, 0644u) << "the mode is still set";

    LogCapture log;
    auto missing = manager_.standardizeOwnershipAtURL(tree() / "missing", kMobileUID, kMobileUID);
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_TRUE(log.contains("Could not stat " + (tree() / "missing").string()));
}

TEST_F(OwnershipTest, FailuresOfOneEntryDoNotStopTheRest) {
    LogCapture log;
    env_->failCall(EnvCall::Chown, 2, EIO);
    env_->failCall(EnvCall::Chmod, 3, EIO);
    ASSERT_TRUE(manager_.standardizeOwnershipAtURL(tree(), kMobileUID, kMobileUID));
    EXPECT_EQ(log.count("Could not chown"), 1u) << log.all();
    EXPECT_EQ(log.count("Could not chmod"), 1u) << log.all();
    int owned = lstatOf(tree() / "sub" / "link").st_uid == kMobileUID;
    for (const auto& item : kOwnedItems)
        owned += lstatOf(tree() / item.name).st_uid == kMobileUID;
    EXPECT_EQ(owned, 7);
}

class ProtectionTest : public FsTest {
protected:
    void SetUp() override {
        fs::create_directories(dir());
        writeFile(file(), "data");
    }
    fs::path dir() { return root_ / "/private/var/containers/Data/A"; }
    fs::path file() { return dir() / "file"; }
    int classOf(const fs::path& p) { return *manager_.dataProtectionClassOfItemAtURL(p); }
};

TEST_F(ProtectionTest, ClassesRoundTripAndThePredicateCanDecline) {
    EXPECT_EQ(classOf(file()), 0) << "no class set";
    for (auto item : {dir(), file()}) {
        ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(item, 2));
        EXPECT_EQ(classOf(item), 2);
        EXPECT_EQ(xattrOf(item), "2");
    }
    int seen = -1;
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file(), 4, [&](int current) {
        seen = current;
        return false;
    }));
    EXPECT_EQ(seen, 2);
    EXPECT_EQ(classOf(file()), 2) << "declined: nothing changed";
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(
        file(), 4, [](int current) { return current < 4; }));
    EXPECT_EQ(classOf(file()), 4);
}

TEST_F(ProtectionTest, ItemsThatCannotHoldAClassAnswerEBADF) {
    fs::create_symlink(file(), dir() / "link");
    ::mkfifo((dir() / "fifo").c_str(), 0600);
    int sock = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const auto socketPath = (dir() / "sock").string();
    ASSERT_LT(socketPath.size(), sizeof address.sun_path);
    socketPath.copy(address.sun_path, socketPath.size());
    ASSERT_EQ(::bind(sock, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);

    LogCapture log;
    for (auto item : {dir() / "link", dir() / "fifo", dir() / "sock"}) {
        auto get = manager_.dataProtectionClassOfItemAtURL(item);
        ASSERT_FALSE(get) << item;
        EXPECT_TRUE(get.error().isPOSIX(EBADF)) << item;
        auto set = manager_.setDataProtectionClassOfItemAtURL(item, 2);
        ASSERT_FALSE(set) << item;
        EXPECT_TRUE(set.error().isPOSIX(EBADF)) << item;
    }
    ::close(sock);
    EXPECT_TRUE(log.contains("Failed to getclass of file " + (dir() / "link").string()));
    EXPECT_TRUE(log.contains("Failed to setclass(2) on file " + (dir() / "fifo").string()));
    EXPECT_EQ(classOf(file()), 0) << "the link's target was not touched";

    auto missing = manager_.setDataProtectionClassOfItemAtURL(dir() / "missing", 2);
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_TRUE(log.contains("Failed to open " + (dir() / "missing").string() + " : "));
}

TEST_F(ProtectionTest, ClassOneItemsCannotChangeWhileLocked) {
    auto other = dir() / "other";
    writeFile(other, "x");
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file(), 1));
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(other, 2));
    auto run = Paths(root_.path()).runDirectory();
    fs::create_directories(run);

    writeFile(run / "lockstate", "1");
    auto changed = manager_.setDataProtectionClassOfItemAtURL(file(), 3);
    ASSERT_FALSE(changed);
    EXPECT_TRUE(changed.error().isPOSIX(EPERM));
    EXPECT_EQ(classOf(file()), 1);
    EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file(), 1)) << "not a change";
    EXPECT_TRUE(manager_.setDataProtectionClassOfItemAtURL(other, 3)) << "other classes can";
    EXPECT_EQ(classOf(other), 3);

    writeFile(run / "lockstate", "0");
    ASSERT_TRUE(manager_.setDataProtectionClassOfItemAtURL(file(), 3));
    EXPECT_EQ(classOf(file()), 3);
}

} // namespace
} // namespace quarn::test
