// Walking, listing and sizing trees.
#include "FsTestSupport.h"

#include <sys/mount.h>

#include <algorithm>
#include <set>

namespace quarn::test {
namespace {

using Kind = QRNFileManager::TraversalEntry::Kind;

class TraverseListTest : public FsTest {
protected:
    void SetUp() override {
        fs::create_directories(top_ / "d1" / "d2");
        fs::create_directories(top_ / "e");
        for (auto f : {"f", "d1/g", "d1/d2/h", ".hidden"})
            writeFile(top_ / f, "x");
        fs::create_directories(root_ / "/outside/inner");
        fs::create_directory_symlink(root_ / "/outside", top_ / "d1" / "out");
    }

    struct Visit {
        Kind kind;
        fs::path path;
        int level;
    };

    std::vector<Visit> walk(const fs::path& at) {
        std::vector<Visit> visits;
        auto walked = manager_._traverseDirectory(at, [&](const auto& entry) -> Status {
            visits.push_back({entry.kind, entry.path, entry.level});
            return {};
        });
        EXPECT_TRUE(walked) << walked.error().description();
        return visits;
    }

    static std::ptrdiff_t indexOf(const std::vector<Visit>& visits, const fs::path& p, Kind k) {
        auto it = std::find_if(visits.begin(), visits.end(),
                               [&](const Visit& v) { return v.path == p && v.kind == k; });
        return it == visits.end() ? -1 : it - visits.begin();
    }

    const fs::path top_ = root_ / "/private/var/containers/tree";
};

TEST_F(TraverseListTest, DirectoriesComeBeforeAndAfterTheirContentsAndLinksAreNotEntered) {
    // Each entry is changed through its parent's descriptor as it is met.
    std::vector<Visit> visits;
    ASSERT_TRUE(manager_._traverseDirectory(top_, [&](const auto& entry) -> Status {
        visits.push_back({entry.kind, entry.path, entry.level});
        if (entry.kind != Kind::DirectoryPostOrder && entry.level > 0) {
            EXPECT_EQ(::fchownat(entry.parentFd, entry.name.c_str(), kMobileUID, kMobileUID,
                                 AT_SYMLINK_NOFOLLOW),
                      0)
                << entry.path;
        }
        return {};
    }));
    // 4 directories twice, 5 files/links once, each between its parent's two visits.
    ASSERT_EQ(visits.size(), 13u);
    EXPECT_EQ(indexOf(visits, top_, Kind::DirectoryPreOrder), 0);
    EXPECT_EQ(indexOf(visits, top_, Kind::DirectoryPostOrder), 12);
    for (std::ptrdiff_t i = 1; i < 12; ++i) {
        const auto& v = visits[i];
        auto pre = indexOf(visits, v.path.parent_path(), Kind::DirectoryPreOrder);
        auto post = indexOf(visits, v.path.parent_path(), Kind::DirectoryPostOrder);
        EXPECT_TRUE(pre >= 0 && pre < i && i < post) << v.path;
        auto relative = v.path.lexically_relative(top_);
        EXPECT_EQ(v.level, std::distance(relative.begin(), relative.end())) << v.path;
    }
    EXPECT_GE(indexOf(visits, top_ / "d1" / "out", Kind::Symlink), 0);
    EXPECT_GE(indexOf(visits, top_ / ".hidden", Kind::File), 0) << "walks see dot-files";
    EXPECT_EQ(lstatOf(top_ / "d1" / "d2" / "h").st_uid, kMobileUID);
    EXPECT_EQ(lstatOf(top_ / "d1" / "out").st_uid, kMobileUID);
    EXPECT_EQ(lstatOf(root_ / "/outside").st_uid, 0u) << "the link's target is not touched";

    auto single = walk(top_ / "f");
    ASSERT_EQ(single.size(), 1u);
    EXPECT_EQ(single[0].kind, Kind::File);
}

TEST_F(TraverseListTest, BlockAndFileSystemErrorsEndTheWalkAndAreReturned) {
    int calls = 0;
    auto walked = manager_._traverseDirectory(top_, [&](const auto& entry) -> Status {
        ++calls;
        if (entry.level == 1)
            return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidPath, "stop at {}", entry.name));
        return {};
    });
    ASSERT_FALSE(walked);
    EXPECT_TRUE(walked.error().isQRN(kQRNErrorInvalidPath));
    EXPECT_EQ(calls, 2) << "no entry after the failing one";

    // The file system's failures name the walk's root.
    calls = 0;
    auto count = [&](const auto&) -> Status {
        ++calls;
        return {};
    };
    EXPECT_TRUE(failedWith(manager_._traverseDirectory(top_ / "missing", count), ENOENT,
                           "Error for path " + (top_ / "missing").string() +
                               ": No such file or directory"));
    env_->failCall(EnvCall::ReadDir, 3, EIO);
    EXPECT_TRUE(failedWith(manager_._traverseDirectory(top_, count), EIO,
                           "Error for path " + top_.string() + ": Input/output error"));
    EXPECT_LT(calls, 13);
    env_->failCall(EnvCall::CloseDir, 1, EBADF);
    EXPECT_TRUE(
        failedWith(manager_._traverseDirectory(top_, count), EBADF,
                   "fts_close failed for " + top_.string() + " with error Bad file descriptor"));
}

TEST_F(TraverseListTest, MountPointsOfOtherFileSystemsAreNotEntered) {
    auto mnt = top_ / "e";
    if (::mount("tmpfs", mnt.c_str(), "tmpfs", 0, "size=1m") != 0)
        GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
    writeFile(mnt / "inside", "x");
    auto visits = walk(top_);
    ::umount2(mnt.c_str(), MNT_DETACH);
    EXPECT_GE(indexOf(visits, mnt, Kind::DirectoryPreOrder), 0);
    EXPECT_GE(indexOf(visits, mnt, Kind::DirectoryPostOrder), 0);
    EXPECT_EQ(indexOf(visits, mnt / "inside", Kind::File), -1);
}

TEST_F(TraverseListTest, ListingSkipsDotNamesMarksDirectoriesButNotLinksAndLogsFailures) {
    // Names below the top, with "/" after those marked as directories.
    std::set<std::string> found;
    for (auto dir : {top_, top_ / "d1"}) {
        auto items = manager_.urlsForItemsInDirectoryAtURL(dir);
        ASSERT_TRUE(items);
        for (const auto& item : *items)
            found.insert(item.url.lexically_relative(top_).string() +
                         (item.isDirectory ? "/" : ""));
    }
    EXPECT_EQ(found, (std::set<std::string>{"d1/", "e/", "f", "d1/d2/", "d1/g", "d1/out"}));

    // Failures are logged, unless the directory is missing.
    EXPECT_TRUE(failedWith(manager_.urlsForItemsInDirectoryAtURL(top_ / "missing"), ENOENT,
                           "_IterateDirectory for " + (top_ / "missing").string() +
                               " returned No such file or directory"));
    EXPECT_FALSE(log_.contains("opendir of"));
    EXPECT_TRUE(failedWith(manager_.urlsForItemsInDirectoryAtURL(top_ / "f"), ENOTDIR));
    EXPECT_TRUE(log_.contains("opendir of " + (top_ / "f").string() + " failed: Not a directory"));
    env_->failCall(EnvCall::ReadDir, 2, EIO);
    EXPECT_TRUE(failedWith(manager_.urlsForItemsInDirectoryAtURL(top_), EIO));
}

TEST_F(TraverseListTest, DirectoryStructureNamesFilesWithoutAnOwnerAccount) {
    writeFile(top_ / "d1" / "stray", "s");
    ::lchown(top_.c_str(), kMobileUID, kMobileUID);
    for (const auto& entry : fs::recursive_directory_iterator(top_))
        ::lchown(entry.path().c_str(), kMobileUID, kMobileUID);
    ASSERT_EQ(::lchown((top_ / "d1" / "stray").c_str(), 4242, 4242), 0);
    manager_.printDirectoryStructureAtURL(top_);
    EXPECT_TRUE(log_.contains("\tOrphaned File: " + (top_ / "d1" / "stray").string()));
    EXPECT_EQ(log_.count("Orphaned File:"), 1u) << log_.all();
    EXPECT_TRUE(log_.contains("\t    g (uid 501, gid 501, mode 644)")) << log_.all();

    log_.clear();
    manager_.printDirectoryStructureAtURL(top_ / "missing");
    EXPECT_TRUE(log_.contains("FTS returned error for " + (top_ / "missing").string() +
                              " : No such file or directory"));
}

TEST_F(FsTest, DiskUsageCountsAllocatedBlocksAndFastSizingTriesDirectoryStatisticsFirst) {
    const auto tree = root_ / "/private/var/containers/Data/A";
    fs::create_directories(tree / "a" / "b");
    writeFile(tree / "small", "x");
    writeFile(tree / "a" / "big", std::string(256 * 1024, 'b'));
    writeFile(tree / "a" / "b" / "medium", std::string(40 * 1024, 'm'));
    writeFile(root_ / "/outside", std::string(512 * 1024, 'o'));
    const auto allocated = [&](std::initializer_list<const char*> items) {
        std::int64_t total = 0;
        for (auto item : items)
            total += static_cast<std::int64_t>(lstatOf(tree / item).st_blocks) * 512;
        return total;
    };
    const auto expected = allocated({"", "a", "a/b", "small", "a/big", "a/b/medium"});
    ASSERT_GE(expected, 296 * 1024) << "the data itself is allocated";
    EXPECT_EQ(manager_.diskUsageForURL(tree / "small"), allocated({"small"}));

    for (bool on : {false, true}) {
        root_.writeFile("/etc/quarnd/features/quarnd.plist",
                        std::string("<plist version=\"1.0\"><dict><key>fast_container_sizing</key>"
                                    "<dict><key>Enabled</key>") +
                            (on ? "<true/>" : "<false/>") + "</dict></dict></plist>\n");
        EXPECT_EQ(manager_.fastDiskUsageForURL(tree), expected);
        EXPECT_EQ(log_.contains("dirstats on " + tree.string() + ":"), on) << "off: walk only";
    }
    // Directory statistics are not kept here: the walk is the fallback.
    EXPECT_TRUE(log_.contains("descendants: 5, total size: " + std::to_string(expected) +
                              ", using fallback"))
        << log_.all();
    for (const auto& bad : {tree / "missing", fs::path()}) {
        EXPECT_LT(manager_.diskUsageForURL(bad), 0) << bad;
        EXPECT_LT(manager_.fastDiskUsageForURL(bad), 0) << bad;
    }

    // A hard link is counted once; a link's target outside is not counted;
    // a sparse file counts what it occupies, not its length.
    fs::create_hard_link(tree / "a" / "big", tree / "again");
    fs::create_symlink(root_ / "/outside", tree / "link");
    EXPECT_EQ(manager_.diskUsageForURL(tree), expected + allocated({"link"}));
    writeFile(tree / "sparse", "");
    fs::resize_file(tree / "sparse", 1 << 30);
    EXPECT_LT(manager_.diskUsageForURL(tree), expected + (1 << 20));
}

} // namespace
} // namespace quarn::test
