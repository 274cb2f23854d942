#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <acl/libacl.h>
#include <climits>
#include <fcntl.h>
#include <random>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

constexpr uid_t kOtherUID = 777;
constexpr gid_t kOtherGID = 778;

std::string randomBytes(std::size_t n) {
    std::mt19937 gen(42);
    std::string s(n, '\0');
    for (auto& c : s) {
        c = static_cast<char>(gen());
    }
    return s;
}

void setTimes(const fs::path& p, time_t seconds, long nanos) {
    const struct timespec times[2] = {{seconds, nanos}, {seconds + 1, nanos}};
    ASSERT_EQ(::utimensat(AT_FDCWD, p.c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << p;
}

// The access ACL in its short text form, or "" when there is none beyond the mode.
std::string aclText(const fs::path& p, acl_type_t type) {
    acl_t acl = ::acl_get_file(p.c_str(), type);
    if (!acl) {
        return "";
    }
    char* text = ::acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE);
    std::string result = text ? text : "";
    ::acl_free(text);
    ::acl_free(acl);
    return result;
}

void setACL(const fs::path& p, acl_type_t type, const char* text) {
    acl_t acl = ::acl_from_text(text);
    ASSERT_NE(acl, nullptr) << text;
    ASSERT_EQ(::acl_set_file(p.c_str(), type, acl), 0) << p << ": " << std::strerror(errno);
    ::acl_free(acl);
}

class MoveCopyTest : public TempRootTest {
protected:
    void SetUp() override {
        env_ = std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
        manager_ = std::make_unique<QRNFileManager>(root_.context(), env_);
        fs::create_directories(dir());
    }

    fs::path dir() { return root_ / "/private/var/containers"; }

    // A tree with every kind of item and metadata the copy must carry.
    fs::path makeRichTree() {
        auto top = dir() / "src";
        fs::create_directories(top / "sub" / "deeper");
        writeFile(top / "data", randomBytes(3 << 20));
        writeFile(top / "sub" / "small", "small");
        writeFile(top / "sub" / "deeper" / "empty", "");
        fs::create_symlink("../data", top / "sub" / "link");
        fs::create_symlink("/nonexistent/target", top / "dangling");
        ::mkfifo((top / "fifo").c_str(), 0640);
        ::chown((top / "data").c_str(), kOtherUID, kOtherGID);
        ::chmod((top / "data").c_str(), 04751); // after the chown, which clears set-id bits
        ::chmod((top / "sub").c_str(), 0710);
        ::chown((top / "sub").c_str(), kMobileUID, kMobileUID);
        ::lchown((top / "sub" / "link").c_str(), kOtherUID, kOtherGID);
        ::setxattr((top / "sub" / "small").c_str(), "user.note", "hello", 5, 0);
        ::setxattr((top / "sub").c_str(), "trusted.quarn.protection_class", "3", 1, 0);
        setACL(top / "sub" / "small", ACL_TYPE_ACCESS, "u::rw-,g::r--,g:1501:rwx,m::rwx,o::---");
        setACL(top / "sub", ACL_TYPE_DEFAULT, "u::rwx,g::r-x,g:1501:rwx,m::rwx,o::---");
        setTimes(top / "sub" / "deeper" / "empty", 1000000000, 123456789);
        setTimes(top / "sub" / "link", 1100000000, 5);
        setTimes(top / "sub" / "deeper", 1200000000, 7);
        setTimes(top / "sub", 1300000000, 9);
        setTimes(top, 1400000000, 11);
        return top;
    }

    // Everything makeRichTree set is found at `top`.
    void expectRichTree(const fs::path& top, const std::string& expectedData) {
        EXPECT_EQ(readFile(top / "data"), expectedData);
        EXPECT_EQ(readFile(top / "sub" / "small"), "small");
        EXPECT_EQ(fs::read_symlink(top / "sub" / "link"), "../data");
        EXPECT_EQ(fs::read_symlink(top / "dangling"), "/nonexistent/target");
        EXPECT_TRUE(S_ISFIFO(lstatOf(top / "fifo").st_mode));
        EXPECT_EQ(lstatOf(top / "fifo").st_mode & 07777, 0640u);

        auto data = lstatOf(top / "data");
        EXPECT_EQ(data.st_mode & 07777, 04751u) << "set-id bit survives the chown";
        EXPECT_EQ(data.st_uid, kOtherUID);
        EXPECT_EQ(data.st_gid, kOtherGID);
        auto sub = lstatOf(top / "sub");
        EXPECT_EQ(sub.st_mode & 07777, 0710u);
        EXPECT_EQ(sub.st_uid, kMobileUID);
        EXPECT_EQ(lstatOf(top / "sub" / "link").st_uid, kOtherUID);

        EXPECT_EQ(xattrOf(top / "sub" / "small", "user.note"), "hello");
        EXPECT_EQ(xattrOf(top / "sub", "trusted.quarn.protection_class"), "3");
        EXPECT_EQ(aclText(top / "sub" / "small", ACL_TYPE_ACCESS),
                  "u::rw-,g::r--,g:1501:rwx,m::rwx,o::---");
        EXPECT_EQ(aclText(top / "sub", ACL_TYPE_DEFAULT), "u::rwx,g::r-x,g:1501:rwx,m::rwx,o::---");

        auto empty = lstatOf(top / "sub" / "deeper" / "empty");
        EXPECT_EQ(empty.st_mtim.tv_sec, 1000000001);
        EXPECT_EQ(empty.st_mtim.tv_nsec, 123456789);
        EXPECT_EQ(empty.st_atim.tv_sec, 1000000000);
        EXPECT_EQ(lstatOf(top / "sub" / "link").st_mtim.tv_sec, 1100000001);
        // Directory times are set after their contents were written.
        EXPECT_EQ(lstatOf(top / "sub" / "deeper").st_mtim.tv_sec, 1200000001);
        EXPECT_EQ(lstatOf(top / "sub").st_mtim.tv_sec, 1300000001);
        EXPECT_EQ(lstatOf(top).st_mtim.tv_sec, 1400000001);
    }

    std::shared_ptr<FaultInjectingEnv> env_;
    std::unique_ptr<QRNFileManager> manager_;
};

TEST_F(MoveCopyTest, CopyCarriesDataAndEveryKindOfMetadata) {
    auto src = makeRichTree();
    const auto data = readFile(src / "data");
    ASSERT_TRUE(manager_->copyItemAtURL(src, dir() / "dst"));
    expectRichTree(dir() / "dst", data);
    expectRichTree(src, data); // the source is untouched
}

TEST_F(MoveCopyTest, MoveAcrossFileSystemsLeavesACompleteDestinationAndNoSource) {
    OtherFileSystemDirectory other;
    if (other.path().empty()) {
        GTEST_SKIP() << "no second file system (/dev/shm) to move across";
    }
    auto src = makeRichTree();
    const auto data = readFile(src / "data");
    if (::setxattr(other.path().c_str(), "user.probe", "1", 1, 0) != 0) {
        GTEST_SKIP() << "/dev/shm holds no user extended attributes: " << std::strerror(errno);
    }
    ASSERT_TRUE(manager_->moveItemAtURL(src, other.path() / "moved"));
    EXPECT_EQ(env_->count(EnvCall::Rename), 1u);
    EXPECT_FALSE(existsNoFollow(src));
    expectRichTree(other.path() / "moved", data);
}

TEST_F(MoveCopyTest, CrossDeviceMoveSucceedsEvenWhenTheSourceCannotBeRemoved) {
    auto src = makeRichTree();
    LogCapture log;
    env_->failCall(EnvCall::Rename, 1, EXDEV); // as between two file systems
    env_->failCallsFrom(EnvCall::Unlink, 1, EIO);
    ASSERT_TRUE(manager_->moveItemAtURL(src, dir() / "moved"));
    EXPECT_TRUE(existsNoFollow(src));
    EXPECT_EQ(readFile(dir() / "moved" / "sub" / "small"), "small");
    EXPECT_TRUE(log.contains("Failed to remove move source after copy at " + src.string() + " : "));
}

TEST_F(MoveCopyTest, MissingSourcesAndTheirMessages) {
    auto missing = dir() / "missing";
    EXPECT_TRUE(manager_->moveItemIfExistsAtURL(missing, dir() / "x"));
    EXPECT_TRUE(manager_->copyItemIfExistsAtURL(missing, dir() / "x"));
    EXPECT_FALSE(existsNoFollow(dir() / "x"));

    auto moved = manager_->moveItemAtURL(missing, dir() / "x");
    ASSERT_FALSE(moved);
    EXPECT_TRUE(moved.error().isPOSIX(ENOENT));
    EXPECT_EQ(moved.error().message, "rename of [" + missing.string() + "] to [" +
                                         (dir() / "x").string() +
                                         "] failed: No such file or directory");
    auto copied = manager_->copyItemAtURL(missing, dir() / "x");
    ASSERT_FALSE(copied);
    EXPECT_TRUE(copied.error().isPOSIX(ENOENT));
    EXPECT_EQ(copied.error().message, "copy of " + missing.string() + " to " +
                                          (dir() / "x").string() +
                                          " failed: No such file or directory");

    env_->failCall(EnvCall::Stat, 1, EIO);
    auto statFailed = manager_->moveItemIfExistsAtURL(missing, dir() / "x");
    ASSERT_FALSE(statFailed);
    EXPECT_EQ(statFailed.error().message,
              "stat of [" + missing.string() + "] failed: Input/output error");
}

TEST_F(MoveCopyTest, MoveWithinAFileSystemIsARename) {
    auto src = makeRichTree();
    auto inode = lstatOf(src / "data").st_ino;
    ASSERT_TRUE(manager_->moveItemIfExistsAtURL(src, dir() / "renamed"));
    EXPECT_EQ(lstatOf(dir() / "renamed" / "data").st_ino, inode);
    EXPECT_EQ(env_->count(EnvCall::Open), 0u) << "nothing copied";
}

TEST_F(MoveCopyTest, CopyNeverOverwritesOrFollowsAtTheDestination) {
    auto src = makeRichTree();
    fs::create_directories(dir() / "existing");
    writeFile(dir() / "existing" / "keep", "keep");
    auto copied = manager_->copyItemAtURL(src, dir() / "existing");
    ASSERT_FALSE(copied);
    EXPECT_TRUE(copied.error().isPOSIX(EEXIST));
    EXPECT_EQ(readFile(dir() / "existing" / "keep"), "keep");

    // A link at the destination name is not written through.
    fs::create_directories(dir() / "elsewhere");
    fs::create_directory_symlink(dir() / "elsewhere", dir() / "linkdst");
    ASSERT_FALSE(manager_->copyItemAtURL(src / "sub" / "small", dir() / "linkdst"));
    EXPECT_EQ(countEntries(dir() / "elsewhere"), 0);
    // A source that is a link is copied as a link.
    ASSERT_TRUE(manager_->copyItemAtURL(src / "sub" / "link", dir() / "copiedlink"));
    EXPECT_EQ(fs::read_symlink(dir() / "copiedlink"), "../data");
}

TEST_F(MoveCopyTest, FailedCopyRemovesWhatItMade) {
    auto src = makeRichTree();
    // Data is cloned, or copied by copy_file_range, or read and written:
    // make all three fail on the second file.
    env_->failCallsFrom(EnvCall::Clone, 2, EIO);
    env_->failCallsFrom(EnvCall::CopyRange, 2, EIO);
    env_->failCallsFrom(EnvCall::Write, 2, EIO);
    env_->failCall(EnvCall::SetXattr, 3, ENOSPC);
    auto copied = manager_->copyItemAtURL(src, dir() / "dst");
    ASSERT_FALSE(copied);
    EXPECT_FALSE(existsNoFollow(dir() / "dst"));
    EXPECT_TRUE(existsNoFollow(src / "sub" / "small"));
}

TEST_F(MoveCopyTest, TreesDeeperThanAPathCanBeAreCopiedAndWalked) {
    makeDeepTree(dir() / "deep", 150);
    ASSERT_TRUE(manager_->copyItemAtURL(dir() / "deep", dir() / "copy"));
    int directories = 0;
    std::string bottom;
    auto walked = manager_->_traverseDirectory(
        dir() / "copy", [&](const QRNFileManager::TraversalEntry& entry) -> Status {
            directories += entry.kind == QRNFileManager::TraversalEntry::Kind::DirectoryPreOrder;
            if (entry.name == "bottom") {
                char buffer[8] = {};
                int fd = ::openat(entry.parentFd, "bottom", O_RDONLY | O_CLOEXEC);
                EXPECT_EQ(::read(fd, buffer, sizeof buffer), 4);
                ::close(fd);
                bottom = buffer;
                EXPECT_GT(entry.path.string().size(), std::size_t{PATH_MAX});
            }
            return {};
        });
    ASSERT_TRUE(walked) << walked.error().description();
    EXPECT_EQ(directories, 151);
    EXPECT_EQ(bottom, "deep");
    EXPECT_TRUE(manager_->removeItemAtURL(dir() / "copy"));
    EXPECT_TRUE(manager_->removeItemAtURL(dir() / "deep"));
}

TEST_F(MoveCopyTest, CopyIntoItsOwnSubdirectoryEnds) {
    auto src = makeRichTree();
    ASSERT_TRUE(manager_->copyItemAtURL(src, src / "sub" / "copy"));
    EXPECT_EQ(readFile(src / "sub" / "copy" / "sub" / "small"), "small");
    EXPECT_FALSE(existsNoFollow(src / "sub" / "copy" / "sub" / "copy"));
}

} // namespace
} // namespace quarn::test
