#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <sys/mount.h>
#include <unistd.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;
using Kind = QRNFileManager::TraversalEntry::Kind;

class TraverseListTest : public TempRootTest {
protected:
    void SetUp() override {
        env_ = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
        manager_ = std::make_unique<QRNFileManager>(root_.context(), env_);
        top_ = root_ / "/private/var/containers/tree";
        fs::create_directories(top_ / "d1" / "d2");
        fs::create_directories(top_ / "e");
        writeFile(top_ / "f", "f");
        writeFile(top_ / "d1" / "g", "g");
        writeFile(top_ / "d1" / "d2" / "h", "h");
        writeFile(top_ / ".hidden", "h");
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
        auto walked = manager_->_traverseDirectory(
            at, [&](const QRNFileManager::TraversalEntry& entry) -> Status {
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

    std::shared_ptr<FaultInjectingEnv> env_;
    std::unique_ptr<QRNFileManager> manager_;
    fs::path top_;
};

TEST_F(TraverseListTest, DirectoriesComeBeforeAndAfterTheirContentsAndLinksAreNotEntered) {
    auto visits = walk(top_);
    // 4 directories twice, 5 files/links once.
    ASSERT_EQ(visits.size(), 13u);
    EXPECT_EQ(visits.front().path, top_);
    EXPECT_EQ(visits.front().kind, Kind::DirectoryPreOrder);
    EXPECT_EQ(visits.back().path, top_);
    EXPECT_EQ(visits.back().kind, Kind::DirectoryPostOrder);
    for (const auto& d : {top_ / "d1", top_ / "d1" / "d2", top_ / "e"}) {
        auto pre = indexOf(visits, d, Kind::DirectoryPreOrder);
        auto post = indexOf(visits, d, Kind::DirectoryPostOrder);
        ASSERT_GE(pre, 0) << d;
        ASSERT_GT(post, pre) << d;
        for (std::ptrdiff_t i = 0; i < static_cast<std::ptrdiff_t>(visits.size()); ++i) {
            bool inside = visits[i].path.string().rfind(d.string() + "/", 0) == 0;
            if (inside) {
                EXPECT_TRUE(i > pre && i < post) << visits[i].path << " outside of " << d;
            }
        }
    }
    auto link = indexOf(visits, top_ / "d1" / "out", Kind::Symlink);
    ASSERT_GE(link, 0);
    EXPECT_EQ(visits[link].level, 2);
    EXPECT_EQ(indexOf(visits, top_ / "d1" / "out" / "inner", Kind::DirectoryPreOrder), -1);
    EXPECT_GE(indexOf(visits, top_ / ".hidden", Kind::File), 0) << "walks see dot-files";
    EXPECT_EQ(visits[indexOf(visits, top_ / "d1" / "d2" / "h", Kind::File)].level, 3);

    auto single = walk(top_ / "f");
    ASSERT_EQ(single.size(), 1u);
    EXPECT_EQ(single[0].kind, Kind::File);
}

TEST_F(TraverseListTest, EntriesCanBeChangedThroughTheirParentDescriptor) {
    auto walked = manager_->_traverseDirectory(
        top_, [&](const QRNFileManager::TraversalEntry& entry) -> Status {
            if (entry.kind != Kind::DirectoryPostOrder && entry.level > 0) {
                EXPECT_EQ(::fchownat(entry.parentFd, entry.name.c_str(), kMobileUID, kMobileUID,
                                     AT_SYMLINK_NOFOLLOW),
                          0)
                    << entry.path;
            }
            return {};
        });
    ASSERT_TRUE(walked);
    EXPECT_EQ(lstatOf(top_ / "d1" / "d2" / "h").st_uid, kMobileUID);
    EXPECT_EQ(lstatOf(top_ / "d1" / "out").st_uid, kMobileUID);
    EXPECT_EQ(lstatOf(root_ / "/outside").st_uid, 0u) << "the link's target is not touched";
}

TEST_F(TraverseListTest, BlockErrorStopsTheWalkAndIsReturned) {
    int calls = 0;
    auto walked = manager_->_traverseDirectory(
        top_, [&](const QRNFileManager::TraversalEntry& entry) -> Status {
            ++calls;
            if (entry.level == 1) {
                return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidPath, "stop at {}", entry.name));
            }
            return {};
        });
    ASSERT_FALSE(walked);
    EXPECT_TRUE(walked.error().isQRN(kQRNErrorInvalidPath));
    EXPECT_EQ(calls, 2) << "no entry after the failing one";
}

TEST_F(TraverseListTest, FileSystemFailuresEndTheWalkWithTheRootInTheMessage) {
    auto missing =
        manager_->_traverseDirectory(top_ / "missing", [](const auto&) -> Status { return {}; });
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_EQ(missing.error().message,
              "Error for path " + (top_ / "missing").string() + ": No such file or directory");

    env_->failCall(EnvCall::ReadDir, 3, EIO);
    int calls = 0;
    auto unreadable = manager_->_traverseDirectory(top_, [&](const auto&) -> Status {
        ++calls;
        return {};
    });
    ASSERT_FALSE(unreadable);
    EXPECT_TRUE(unreadable.error().isPOSIX(EIO));
    EXPECT_EQ(unreadable.error().message,
              "Error for path " + top_.string() + ": Input/output error");
    EXPECT_LT(calls, 13);

    env_->failCall(EnvCall::CloseDir, 1, EBADF);
    auto closeFailed = manager_->_traverseDirectory(top_, [](const auto&) -> Status { return {}; });
    ASSERT_FALSE(closeFailed);
    EXPECT_EQ(closeFailed.error().message,
              "fts_close failed for " + top_.string() + " with error Bad file descriptor");
}

TEST_F(TraverseListTest, MountPointsOfOtherFileSystemsAreNotEntered) {
    auto mnt = top_ / "e";
    if (::mount("tmpfs", mnt.c_str(), "tmpfs", 0, "size=1m") != 0) {
        GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
    }
    writeFile(mnt / "inside", "x");
    auto visits = walk(top_);
    ::umount2(mnt.c_str(), MNT_DETACH);
    EXPECT_GE(indexOf(visits, mnt, Kind::DirectoryPreOrder), 0);
    EXPECT_GE(indexOf(visits, mnt, Kind::DirectoryPostOrder), 0);
    EXPECT_EQ(indexOf(visits, mnt / "inside", Kind::File), -1);
}

TEST_F(TraverseListTest, ListingSkipsDotNamesAndMarksDirectories) {
    auto items = manager_->urlsForItemsInDirectoryAtURL(top_);
    ASSERT_TRUE(items);
    std::map<std::string, bool> found;
    for (const auto& item : *items) {
        EXPECT_EQ(item.url.parent_path(), top_);
        found[item.url.filename().string()] = item.isDirectory;
    }
    EXPECT_EQ(found, (std::map<std::string, bool>{{"d1", true}, {"e", true}, {"f", false}}));

    auto withLink = manager_->urlsForItemsInDirectoryAtURL(top_ / "d1");
    ASSERT_TRUE(withLink);
    for (const auto& item : *withLink) {
        if (item.url.filename() == "out") {
            EXPECT_FALSE(item.isDirectory) << "a link to a directory is not a directory";
        }
    }
}

TEST_F(TraverseListTest, ListingFailuresAreLoggedUnlessTheDirectoryIsMissing) {
    LogCapture log;
    auto missing = manager_->urlsForItemsInDirectoryAtURL(top_ / "missing");
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_EQ(missing.error().message, "_IterateDirectory for " + (top_ / "missing").string() +
                                           " returned No such file or directory");
    EXPECT_FALSE(log.contains("opendir of"));

    auto file = manager_->urlsForItemsInDirectoryAtURL(top_ / "f");
    ASSERT_FALSE(file);
    EXPECT_TRUE(file.error().isPOSIX(ENOTDIR));
    EXPECT_TRUE(log.contains("opendir of " + (top_ / "f").string() + " failed: Not a directory"));

    env_->failCall(EnvCall::ReadDir, 2, EIO);
    auto broken = manager_->urlsForItemsInDirectoryAtURL(top_);
    ASSERT_FALSE(broken);
    EXPECT_TRUE(broken.error().isPOSIX(EIO));
}

} // namespace
} // namespace quarn::test
