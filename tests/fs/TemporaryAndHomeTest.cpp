#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <unistd.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class TemporaryAndHomeTest : public TempRootTest {
protected:
    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
};

TEST_F(TemporaryAndHomeTest, TemporaryDirectoriesAreUniqueAndPrivateInTheDirectory) {
    auto in = root_ / "/tmp";
    fs::create_directories(in);
    auto first = manager().createTemporaryDirectoryInDirectoryURL(in);
    auto second = manager().createTemporaryDirectoryInDirectoryURL(in);
    ASSERT_TRUE(first);
    ASSERT_TRUE(second);
    EXPECT_NE(*first, *second);
    for (const auto& made : {*first, *second}) {
        EXPECT_EQ(made.parent_path(), in);
        EXPECT_EQ(made.filename().string().size(), std::string("temp.").size() + 6);
        EXPECT_EQ(made.filename().string().rfind("temp.", 0), 0u);
        EXPECT_EQ(lstatOf(made).st_mode & 07777, 0700u);
    }
    auto named = manager().createTemporaryDirectoryInDirectoryURL(in, "Staging-");
    ASSERT_TRUE(named);
    EXPECT_EQ(named->filename().string().rfind("Staging-", 0), 0u);
}

TEST_F(TemporaryAndHomeTest, TemporaryDirectoryFailures) {
    auto missing = root_ / "/nowhere";
    auto failed = manager().createTemporaryDirectoryInDirectoryURL(missing);
    ASSERT_FALSE(failed);
    EXPECT_TRUE(failed.error().isPOSIX(ENOENT));
    EXPECT_EQ(failed.error().message, "Failed to create temp dir at path " +
                                          (missing / "temp.XXXXXX").string() +
                                          " : No such file or directory");
    // A prefix must not lead out of the directory.
    auto escaping = manager().createTemporaryDirectoryInDirectoryURL(root_ / "/tmp", "../x");
    ASSERT_FALSE(escaping);
    EXPECT_TRUE(escaping.error().isPOSIX(EINVAL));
}

TEST_F(TemporaryAndHomeTest, HomeDirectoryIsTheRealPathOfTheAccountsHome) {
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(kMobileUID),
              fs::canonical(root_ / "/private/var/mobile"));

    // A home reached through a link resolves to where it really is.
    fs::create_directories(root_ / "/data/real-home");
    fs::create_directory_symlink(root_ / "/data/real-home", root_ / "/private/var/linked");
    root_.writeFile("/etc/passwd", "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                   "linked:x:600:600::/private/var/linked:/bin/sh\n"
                                   "ghost:x:601:601::/private/var/ghost:/bin/sh\n");
    EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(600),
              fs::canonical(root_ / "/data/real-home"));
}

TEST_F(TemporaryAndHomeTest, UnknownUsersAndMissingHomesFallBackToMobile) {
    root_.writeFile("/etc/passwd", "ghost:x:601:601::/private/var/ghost:/bin/sh\n");
    const auto fallback = root_ / "/private/var/mobile";
    {
        LogCapture log;
        EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(4242), fallback);
        EXPECT_TRUE(log.contains("Failed to getpwuid for uid: 4242"));
        EXPECT_TRUE(log.contains("Failed to get home dir using getpwuid for uid: 4242"));
    }
    {
        LogCapture log;
        EXPECT_EQ(QRNFileManager::homeDirectoryURLForPOSIXUID(601), fallback);
        EXPECT_FALSE(log.contains("Failed to getpwuid"));
        EXPECT_TRUE(log.contains("Failed to get home dir using getpwuid for uid: 601"));
    }
}

TEST_F(TemporaryAndHomeTest, ExistenceDoesNotFollowLinks) {
    auto dir = root_ / "/private/var/containers";
    fs::create_directories(dir);
    fs::create_symlink(dir / "gone", dir / "dangling");
    EXPECT_TRUE(manager().itemExistsAtURL(dir / "dangling"));
    EXPECT_FALSE(manager().itemDoesNotExistAtURL(dir / "dangling"));
    EXPECT_TRUE(manager().itemDoesNotExistAtURL(dir / "gone"));
    EXPECT_FALSE(manager().itemExistsAtURL({}));
}

TEST_F(TemporaryAndHomeTest, DirectoryStructureNamesFilesWithoutAnOwnerAccount) {
    auto dir = root_ / "/private/var/containers/c";
    fs::create_directories(dir / "sub");
    writeFile(dir / "sub" / "stray", "s");
    writeFile(dir / "mine", "m");
    ASSERT_EQ(::chown((dir / "sub" / "stray").c_str(), 4242, 4242), 0);
    ASSERT_EQ(::chown((dir / "mine").c_str(), kMobileUID, kMobileUID), 0);
    ASSERT_EQ(::chown(dir.c_str(), kMobileUID, kMobileUID), 0);
    ASSERT_EQ(::chown((dir / "sub").c_str(), kMobileUID, kMobileUID), 0);
    LogCapture log;
    manager().printDirectoryStructureAtURL(dir);
    EXPECT_TRUE(log.contains("\tOrphaned File: " + (dir / "sub" / "stray").string()));
    EXPECT_EQ(log.count("Orphaned File:"), 1u) << log.all();
    EXPECT_TRUE(log.contains("mine"));

    log.clear();
    manager().printDirectoryStructureAtURL(dir / "missing");
    EXPECT_TRUE(log.contains("FTS returned error for " + (dir / "missing").string() +
                             " : No such file or directory"));
}

} // namespace
} // namespace quarn::test
