// Removal, moves and copies of whole trees.
#include "FsTestSupport.h"

#include "Daemon/support/Descriptor.h"

#include <algorithm>
#include <climits>

namespace quarn::test {
namespace {

class RemoveTest : public FsTest {
protected:
    void SetUp() override { fs::create_directories(dir()); }
    fs::path dir() { return root_ / "/private/var/containers/Data"; }

    // name/{f1,f2,b/{f3,fifo,c/{f4}},empty/,link}
    fs::path makeTree(const char* name = "a") {
        auto top = dir() / name;
        fs::create_directories(top / "b" / "c");
        fs::create_directories(top / "empty");
        for (auto f : {"f1", "f2", "b/f3", "b/c/f4"})
            writeFile(top / f, f);
        fs::create_symlink("f1", top / "link");
        ::mkfifo((top / "b" / "fifo").c_str(), 0600);
        return top;
    }
};

TEST_F(RemoveTest, RemovesWholeTreesNeverFollowingLinksAndTreatsMissingItemsAsSuccess) {
    auto outside = root_ / "/outside";
    fs::create_directories(outside / "sub");
    writeFile(outside / "sub" / "keep", "k");
    auto top = makeTree();
    fs::create_directory_symlink(outside, top / "b" / "dirlink");
    fs::create_symlink(outside / "sub" / "keep", top / "filelink");
    fs::create_symlink(outside / "sub", dir() / "rootlink");
    writeFile(dir() / "file", "x");
    ASSERT_TRUE(manager_.removeItemAtURL(top));
    // One unlink per entry and the root: nothing walked twice.
    EXPECT_EQ(env_->count(EnvCall::Unlink), 12u);
    ASSERT_TRUE(manager_.removeItemAtURL(dir() / "rootlink")) << "the root itself a link";
    ASSERT_TRUE(manager_.removeItemAtURL(dir() / "file"));
    EXPECT_EQ(countEntries(dir()), 0);
    EXPECT_EQ(readFile(outside / "sub" / "keep"), "k");
    EXPECT_TRUE(manager_.removeItemAtURL(top)) << "already gone";
    EXPECT_TRUE(manager_.removeItemAtURL(dir() / "no" / "such" / "parent"));
    makeTree();
    EXPECT_TRUE(manager_.removeItemAtURL(dir().string() + "/a/")) << "trailing separator";
    EXPECT_FALSE(existsNoFollow(dir() / "a"));

    EXPECT_TRUE(failedWith(manager_.removeItemAtURL({}), EFAULT,
                           "nil url passed to -removeItemAtURL:error:"));
}

TEST_F(RemoveTest, ImmutableEntriesHaveTheFlagClearedAndAreRemoved) {
    auto top = makeTree();
    fs::create_directories(top / "frozen" / "inner");
    fs::create_directories(top / "frozenEmpty");
    writeFile(top / "frozen" / "g", "g");
    int err = setImmutable(top / "f1", true);
    if (err == EOPNOTSUPP || err == ENOTTY || err == EINVAL)
        GTEST_SKIP() << "the file system refuses the immutable flag (" << std::strerror(err) << ")";
    ASSERT_EQ(err, 0);
    // A directory that is immutable blocks removing what is inside it.
    ASSERT_EQ(setImmutable(top / "frozen", true), 0);
    ASSERT_EQ(setImmutable(top / "frozenEmpty", true), 0);

    auto removed = manager_.removeItemAtURL(top);
    for (auto frozen : {"f1", "frozen", "frozenEmpty"})
        setImmutable(top / frozen, false); // let the fixture clean up if it failed
    ASSERT_TRUE(removed) << removed.error().description() << "\n" << log_.all();
    EXPECT_FALSE(existsNoFollow(top));
    auto messages = log_.messages();
    EXPECT_EQ(std::count(messages.begin(), messages.end(),
                         "Unset the immutable flag on " + (top / "frozen").string()),
              1)
        << "cleared once, not once per child";
}

TEST_F(RemoveTest, FailingEntriesAreReportedWhileTheRestOfTheTreeGoes) {
    auto top = makeTree();
    env_->failCall(EnvCall::Unlink, 3, EIO);
    env_->failCall(EnvCall::Unlink, 5, EACCES);
    // The first error wins.
    EXPECT_TRUE(failedWith(manager_.removeItemAtURL(top), EIO,
                           "remove of " + top.string() + " failed: Input/output error"));
    // Only the two entries that failed and the directories holding them are left.
    EXPECT_GE(countEntries(top), 1);
    EXPECT_LE(countEntries(top), 4);
    EXPECT_GT(env_->count(EnvCall::Unlink), 9u) << "the walk went on";
    env_->clearFailures();
    ASSERT_TRUE(manager_.removeItemAtURL(top));
    EXPECT_FALSE(existsNoFollow(top));

    // EPERM with no immutable flag in the way; a directory that cannot be read.
    for (auto [call, nth, err] :
         {std::tuple{EnvCall::Unlink, 1, EPERM}, {EnvCall::ReadDir, 2, EIO}}) {
        top = makeTree(envCallName(call));
        env_->failCall(call, nth, err);
        EXPECT_TRUE(failedWith(manager_.removeItemAtURL(top), err)) << envCallName(call);
        EXPECT_TRUE(existsNoFollow(top));
    }
    EXPECT_EQ(env_->count(EnvCall::SetFlags), 0u) << "no flag was in the way";
}

constexpr uid_t kOtherUID = 777;
constexpr gid_t kOtherGID = 778;
constexpr const char* kFileACL = "u::rw-,g::r--,g:1501:rwx,m::rwx,o::---";
constexpr const char* kDefaultACL = "u::rwx,g::r-x,g:1501:rwx,m::rwx,o::---";

void setACL(const fs::path& p, acl_type_t type, const char* text) {
    acl_t acl = ::acl_from_text(text);
    ASSERT_EQ(::acl_set_file(p.c_str(), type, acl), 0) << p << ": " << std::strerror(errno);
    ::acl_free(acl);
}

class MoveCopyTest : public RemoveTest {
protected:
    // Access and modification times set on items of the rich tree, the
    // directories after their contents, which a copy must set in that order.
    static constexpr std::pair<const char*, time_t> kTimes[] = {{"sub/deeper/empty", 1000000000},
                                                                {"sub/link", 1100000000},
                                                                {"sub/deeper", 1200000000},
                                                                {"sub", 1300000000},
                                                                {"", 1400000000}};

    // A tree with every kind of item and metadata the copy must carry.
    fs::path makeRichTree() {
        auto top = dir() / "src";
        fs::create_directories(top / "sub" / "deeper");
        data_.resize(3 << 20);
        for (std::size_t i = 0; i < data_.size(); ++i)
            data_[i] = static_cast<char>(i % 251);
        writeFile(top / "data", data_);
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
        ::setxattr((top / "sub").c_str(), kProtectionClassAttribute, "3", 1, 0);
        setACL(top / "sub" / "small", ACL_TYPE_ACCESS, kFileACL);
        setACL(top / "sub", ACL_TYPE_DEFAULT, kDefaultACL);
        for (auto [item, seconds] : kTimes) {
            const struct timespec times[2] = {{seconds, seconds % 997},
                                              {seconds + 1, seconds % 997}};
            EXPECT_EQ(::utimensat(AT_FDCWD, (top / item).c_str(), times, AT_SYMLINK_NOFOLLOW), 0);
        }
        return top;
    }

    // Everything makeRichTree set is found at `top`.
    void expectRichTree(const fs::path& top) {
        EXPECT_EQ(readFile(top / "data"), data_);
        EXPECT_EQ(readFile(top / "sub" / "small"), "small");
        EXPECT_EQ(fs::read_symlink(top / "sub" / "link"), "../data");
        EXPECT_EQ(fs::read_symlink(top / "dangling"), "/nonexistent/target");
        EXPECT_TRUE(S_ISFIFO(lstatOf(top / "fifo").st_mode));
        EXPECT_EQ(describe(top / "fifo"), "640 0:0 -");
        EXPECT_EQ(describe(top / "data"), "4751 777:778 -") << "set-id bit survives the chown";
        EXPECT_EQ(describe(top / "sub"), "710 501:501 3");
        EXPECT_EQ(lstatOf(top / "sub" / "link").st_uid, kOtherUID);
        EXPECT_EQ(xattrOf(top / "sub" / "small", "user.note"), "hello");
        EXPECT_EQ(aclText(top / "sub" / "small"), kFileACL);
        EXPECT_EQ(aclText(top / "sub", ACL_TYPE_DEFAULT), kDefaultACL);
        for (auto [item, seconds] : kTimes) {
            const auto st = lstatOf(top / item);
            EXPECT_EQ(st.st_mtim.tv_nsec, seconds % 997) << item;
            EXPECT_EQ(st.st_mtim.tv_sec, seconds + 1) << item;
        }
        // Reading the tree moves other items' access times; an empty file's stays.
        EXPECT_EQ(lstatOf(top / kTimes[0].first).st_atim.tv_sec, kTimes[0].second);
    }

    std::string data_;
};

TEST_F(MoveCopyTest, MoveIsARenameOrACopyAcrossDevicesThatSucceedsEvenWhenTheSourceStays) {
    auto src = makeRichTree();
    auto inode = lstatOf(src / "data").st_ino;
    ASSERT_TRUE(manager_.moveItemIfExistsAtURL(src, dir() / "renamed"));
    EXPECT_EQ(lstatOf(dir() / "renamed" / "data").st_ino, inode);
    EXPECT_EQ(env_->count(EnvCall::Mkdir), 0u) << "nothing copied";

    // Between two file systems the tree is copied and the source removed.
    env_->failCall(EnvCall::Rename, 1, EXDEV);
    ASSERT_TRUE(manager_.moveItemAtURL(dir() / "renamed", dir() / "moved"));
    EXPECT_FALSE(existsNoFollow(dir() / "renamed"));
    expectRichTree(dir() / "moved");

    src = dir() / "moved";
    env_->failCall(EnvCall::Rename, 1, EXDEV);
    env_->failCallsFrom(EnvCall::Unlink, 1, EIO);
    ASSERT_TRUE(manager_.moveItemAtURL(src, dir() / "again"));
    EXPECT_TRUE(existsNoFollow(src));
    EXPECT_EQ(readFile(dir() / "again" / "sub" / "small"), "small");
    EXPECT_TRUE(
        log_.contains("Failed to remove move source after copy at " + src.string() + " : "));
}

TEST_F(MoveCopyTest, MissingSourcesAndTheirMessages) {
    const auto missing = dir() / "missing";
    const auto x = dir() / "x";
    EXPECT_TRUE(manager_.moveItemIfExistsAtURL(missing, x));
    EXPECT_TRUE(manager_.copyItemIfExistsAtURL(missing, x));
    EXPECT_FALSE(existsNoFollow(x));

    EXPECT_TRUE(failedWith(manager_.moveItemAtURL(missing, x), ENOENT,
                           "rename of [" + missing.string() + "] to [" + x.string() +
                               "] failed: No such file or directory"));
    EXPECT_TRUE(failedWith(manager_.copyItemAtURL(missing, x), ENOENT,
                           "copy of " + missing.string() + " to " + x.string() +
                               " failed: No such file or directory"));
    env_->failCall(EnvCall::Stat, 1, EIO);
    EXPECT_TRUE(failedWith(manager_.moveItemIfExistsAtURL(missing, x), EIO,
                           "stat of [" + missing.string() + "] failed: Input/output error"));
}

TEST_F(MoveCopyTest, CopyCarriesEverythingNeverOverwritesOrFollowsAndRemovesWhatAFailureMade) {
    auto src = makeRichTree();
    // Data is cloned, or copied by copy_file_range, or read and written:
    // make all three fail on the second file.
    env_->failCallsFrom(EnvCall::Clone, 2, EIO);
    env_->failCallsFrom(EnvCall::CopyRange, 2, EIO);
    env_->failCallsFrom(EnvCall::Write, 2, EIO);
    env_->failCall(EnvCall::SetXattr, 3, ENOSPC);
    ASSERT_FALSE(manager_.copyItemAtURL(src, dir() / "dst"));
    EXPECT_FALSE(existsNoFollow(dir() / "dst"));
    env_->clearFailures();
    ASSERT_TRUE(manager_.copyItemAtURL(src, dir() / "dst"));
    expectRichTree(dir() / "dst");
    expectRichTree(src); // the source is untouched

    fs::create_directories(dir() / "existing");
    writeFile(dir() / "existing" / "keep", "keep");
    EXPECT_TRUE(failedWith(manager_.copyItemAtURL(src, dir() / "existing"), EEXIST));
    EXPECT_EQ(readFile(dir() / "existing" / "keep"), "keep");
    // A link at the destination name is not written through.
    fs::create_directories(dir() / "elsewhere");
    fs::create_directory_symlink(dir() / "elsewhere", dir() / "linkdst");
    ASSERT_FALSE(manager_.copyItemAtURL(src / "sub" / "small", dir() / "linkdst"));
    EXPECT_EQ(countEntries(dir() / "elsewhere"), 0);
    // A source that is a link is copied as a link.
    ASSERT_TRUE(manager_.copyItemAtURL(src / "sub" / "link", dir() / "copiedlink"));
    EXPECT_EQ(fs::read_symlink(dir() / "copiedlink"), "../data");
    // A copy into its own subdirectory ends.
    ASSERT_TRUE(manager_.copyItemAtURL(src, src / "sub" / "copy"));
    EXPECT_EQ(readFile(src / "sub" / "copy" / "sub" / "small"), "small");
    EXPECT_FALSE(existsNoFollow(src / "sub" / "copy" / "sub" / "copy"));
}

TEST_F(MoveCopyTest, TreesDeeperThanAPathCanBeAreCopiedWalkedAndRemoved) {
    makeDeepTree(dir() / "deep", 150); // about 6000 characters of path
    ASSERT_TRUE(manager_.copyItemAtURL(dir() / "deep", dir() / "copy"));
    // The copy is walked by descriptor, its bottom file read through its parent's.
    int directories = 0;
    char bottom[8] = {};
    auto walked = manager_._traverseDirectory(dir() / "copy", [&](const auto& entry) -> Status {
        directories += entry.kind == QRNFileManager::TraversalEntry::Kind::DirectoryPreOrder;
        if (entry.name == "bottom") {
            Descriptor fd(::openat(entry.parentFd, "bottom", O_RDONLY | O_CLOEXEC));
            EXPECT_EQ(::read(fd.get(), bottom, sizeof bottom), 4);
            EXPECT_GT(entry.path.string().size(), std::size_t{PATH_MAX});
        }
        return {};
    });
    ASSERT_TRUE(walked) << walked.error().description();
    EXPECT_EQ(directories, 151);
    EXPECT_STREQ(bottom, "deep");
    EXPECT_TRUE(manager_.removeItemAtURL(dir() / "copy"));
    EXPECT_TRUE(manager_.removeItemAtURL(dir() / "deep"));
    EXPECT_EQ(countEntries(dir()), 0);
}

} // namespace
} // namespace quarn::test
