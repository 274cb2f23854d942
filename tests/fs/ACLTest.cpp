#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/support/QRNError.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <acl/libacl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <set>
#include <sstream>
#include <string>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;
using Entries = std::set<std::string>;

// "user::rwx", "group:1501:-wx", ... read back with libacl.
Entries entriesOf(const fs::path& path, acl_type_t type) {
    acl_t acl = acl_get_file(path.c_str(), type);
    char* text = acl ? acl_to_any_text(acl, nullptr, ',', TEXT_NUMERIC_IDS) : nullptr;
    if (!text) {
        ADD_FAILURE() << "cannot read the ACL of " << path;
        return {};
    }
    Entries entries;
    std::stringstream list(text);
    for (std::string entry; std::getline(list, entry, ',');) {
        entries.insert(entry);
    }
    acl_free(text);
    acl_free(acl);
    return entries;
}

const Entries kFullBelowTop = {"user::---", "group::---", "other::---", "group:1501:rwx",
                               "mask::rwx"};

class ACLTest : public TempRootTest {
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
    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
    fs::path container() { return root_ / "/private/var/containers/Data/System/C1"; }
};

TEST_F(ACLTest, TopLevelGrantsAddingOnlyAndPassesFullRightsDown) {
    ASSERT_TRUE(manager().setTopLevelSystemContainerACLAtURL(container()));
    const Entries base = {"user::rwx", "group::r-x", "other::r-x"};
    Entries access = base, defaults = base;
    access.insert({"group:1501:-wx", "mask::rwx"});
    defaults.insert({"group:1501:rwx", "mask::rwx"});
    EXPECT_EQ(entriesOf(container(), ACL_TYPE_ACCESS), access);
    EXPECT_EQ(entriesOf(container(), ACL_TYPE_DEFAULT), defaults);
    EXPECT_EQ(lstatOf(container()).st_uid, 0u);

    // Applying again replaces rather than accumulates, and a new item inherits.
    ASSERT_TRUE(manager().setTopLevelSystemContainerACLAtURL(container()));
    EXPECT_EQ(entriesOf(container(), ACL_TYPE_ACCESS), access);
    fs::create_directory(container() / "Documents");
    EXPECT_EQ(entriesOf(container() / "Documents", ACL_TYPE_ACCESS).count("group:1501:rwx"), 1u);
}

TEST_F(ACLTest, SystemContainerTreeIsStandardized) {
    ASSERT_TRUE(manager().standardizeACLsForSystemContainerAtURL(container()));

    EXPECT_EQ(entriesOf(container(), ACL_TYPE_ACCESS).count("group:1501:-wx"), 1u);
    EXPECT_EQ(lstatOf(container()).st_uid, 0u);
    EXPECT_EQ(lstatOf(container()).st_mode & 0700, 0700u) << "the top keeps its mode";

    for (auto dir : {container() / "Library", container() / "Library" / "Caches"}) {
        EXPECT_EQ(entriesOf(dir, ACL_TYPE_ACCESS), kFullBelowTop) << dir;
        EXPECT_EQ(entriesOf(dir, ACL_TYPE_DEFAULT), kFullBelowTop) << dir;
    }
    for (auto item : {container() / "Library" / "tool", container() / "Library" / "pipe"}) {
        EXPECT_EQ(entriesOf(item, ACL_TYPE_ACCESS), kFullBelowTop) << item;
    }
    for (auto item : {container() / "Library", container() / "Library" / "tool",
                      container() / "Library" / "link"}) {
        auto st = lstatOf(item);
        EXPECT_EQ(st.st_uid, 65534u) << item;
        EXPECT_EQ(st.st_gid, 65534u) << item;
        if (!S_ISLNK(st.st_mode)) {
            EXPECT_EQ(st.st_mode & 07777, 070u) << item << ": only the mask shows in the mode";
        }
    }

    auto meta = container() / ".com.orvex.quarn_store.metadata.plist";
    EXPECT_EQ(entriesOf(meta, ACL_TYPE_ACCESS), (Entries{"user::rw-", "group::---", "other::---"}));
    EXPECT_EQ(lstatOf(meta).st_uid, 0u);

    // The link was not followed.
    auto outside = lstatOf(root_ / "/outside");
    EXPECT_EQ(outside.st_uid, 0u);
    EXPECT_EQ(outside.st_mode & 07777, 0600u);
    EXPECT_EQ(entriesOf(root_ / "/outside", ACL_TYPE_ACCESS).size(), 3u);
}

TEST_F(ACLTest, OrdinaryTreeGetsTheDirectoryListAtItsTopToo) {
    ASSERT_TRUE(manager().standardizeACLsAtURL(container(), false));
    EXPECT_EQ(entriesOf(container(), ACL_TYPE_ACCESS), kFullBelowTop);
    EXPECT_EQ(lstatOf(container()).st_uid, 65534u);
}

TEST_F(ACLTest, MissingGroupFailsWithTheACLCode) {
    root_.writeFile("/etc/group", "wheel:x:0:\n");
    LogCapture log;
    auto top = manager().setTopLevelSystemContainerACLAtURL(container());
    ASSERT_FALSE(top);
    EXPECT_TRUE(top.error().isQRN(kQRNErrorSetACLFailed));
    EXPECT_TRUE(log.contains("group lookup failed"));
    auto tree = manager().standardizeACLsAtURL(container(), true);
    ASSERT_FALSE(tree);
    EXPECT_TRUE(tree.error().isQRN(kQRNErrorSetACLFailed));
    EXPECT_EQ(entriesOf(container(), ACL_TYPE_ACCESS).size(), 3u) << "nothing was touched";
}

TEST_F(ACLTest, AllSystemContainersOfADirectory) {
    auto parent = container().parent_path();
    fs::create_directories(parent / "C2" / "Library");
    EXPECT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(parent / "missing"));

    LogCapture log;
    ASSERT_TRUE(manager().standardizeAllSystemContainerACLsAtURL(parent));
    EXPECT_TRUE(log.contains("Potential containers requiring ACL migration"));
    for (auto c : {container(), parent / "C2"}) {
        EXPECT_EQ(entriesOf(c, ACL_TYPE_ACCESS).count("group:1501:-wx"), 1u) << c;
        EXPECT_EQ(entriesOf(c / "Library", ACL_TYPE_DEFAULT), kFullBelowTop) << c;
    }

    // Every container is tried; the call still reports the failure.
    root_.writeFile("/etc/group", "wheel:x:0:\n");
    EXPECT_FALSE(manager().standardizeAllSystemContainerACLsAtURL(parent));
    EXPECT_EQ(log.count("Failed to set system container ACL at"), 2u);
}

} // namespace
} // namespace quarn::test
