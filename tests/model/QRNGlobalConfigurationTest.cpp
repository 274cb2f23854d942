#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/xattr.h>

#include <fstream>
#include <thread>

using namespace quarn;
using quarn::test::LogCapture;
using quarn::test::TempRoot;

namespace {

struct Stat {
    bool exists = false;
    mode_t mode = 0;
    uid_t uid = 0;
    gid_t gid = 0;
};

Stat statOf(const std::filesystem::path& p) {
    struct stat st {};
    if (lstat(p.c_str(), &st) != 0) {
        return {};
    }
    return {S_ISDIR(st.st_mode), st.st_mode & 07777, st.st_uid, st.st_gid};
}

std::string protectionClassOf(const std::filesystem::path& p) {
    char buf[32] = {};
    ssize_t n = getxattr(p.c_str(), "trusted.quarn.protection_class", buf, sizeof(buf) - 1);
    return n < 0 ? std::string() : std::string(buf, static_cast<std::size_t>(n));
}

// A directory made by the configuration: mode 0755 and the owner given.
void expectDirectory(const std::filesystem::path& p, uid_t owner) {
    SCOPED_TRACE(p.string());
    Stat s = statOf(p);
    ASSERT_TRUE(s.exists);
    EXPECT_EQ(s.mode, 0755u);
    EXPECT_EQ(s.uid, owner);
    EXPECT_EQ(s.gid, owner);
}

class QRNGlobalConfigurationTest : public quarn::test::TempRootTest {
protected:
    QRNGlobalConfiguration& config() { return QRNGlobalConfiguration::sharedInstance(); }
    QRNUserIdentityPtr mobile() { return QRNUserIdentitySharedCache::defaultUserIdentity(); }
    std::filesystem::path home() {
        return std::filesystem::canonical(root_ / "/private/var/mobile");
    }
};

} // namespace

TEST_F(QRNGlobalConfigurationTest, GlobalDirectoriesPathsModesOwners) {
    auto& c = config();
    const auto daemonHome = root_ / "/private/var/root";
    const auto containers = root_ / "/private/var/containers";
    const auto caches = daemonHome / "Library/Caches/com.orvex.quarnd";
    const auto library = daemonHome / "Library/Quarn";

    EXPECT_EQ(c.sharedContainersDirectory(), containers);
    EXPECT_EQ(c.logDirectory(), daemonHome / "Library/Logs/Quarn");
    EXPECT_EQ(c.cachesDirectory(), caches);
    EXPECT_EQ(c.libraryDirectory(), library);
    EXPECT_EQ(c.transientDirectory(), caches / "Temp");
    EXPECT_EQ(c.transientBundleDirectory(), containers / "Temp");
    EXPECT_EQ(c.stagingDirectory(), caches / "Staging");
    EXPECT_EQ(c.deathrowDirectory(), caches / "Dead");
    EXPECT_EQ(c.replaceDirectory(), library / "Replace");
    EXPECT_EQ(c.pendingUpdatesDirectory(), library / "PendingUpdates");
    EXPECT_EQ(c.bundleDirectory(), containers / "Bundle");
    EXPECT_EQ(c.legacyTransientBundleDirectory(),
              root_ / "/private/var/installer/Library/Caches/com.orvex.quarnd");

    for (const auto& p : {containers, caches, library, caches / "Temp", caches / "Staging",
                          caches / "Dead", library / "Replace", library / "PendingUpdates",
                          containers / "Bundle", daemonHome / "Library/Logs/Quarn"}) {
        expectDirectory(p, 0);
    }
    // Bundles are installed by the installer, which owns their transient home.
    expectDirectory(containers / "Temp", 33);
    EXPECT_FALSE(statOf(c.legacyTransientBundleDirectory()).exists);

    // The daemon's own directories stay readable whatever the lock state.
    EXPECT_EQ(protectionClassOf(c.logDirectory()), "4");
    EXPECT_EQ(protectionClassOf(caches), "4");
    EXPECT_EQ(protectionClassOf(library), "4");
    EXPECT_EQ(protectionClassOf(containers), "");
}

TEST_F(QRNGlobalConfigurationTest, PerUserDirectoriesBelongToTheUser) {
    auto user = config().getPerUserConfigurationForUserIdentity(mobile());
    ASSERT_NE(user, nullptr);
    EXPECT_EQ(user, config().getPerUserConfigurationForUserIdentity(mobile()));
    const auto h = home();
    EXPECT_EQ(user->userHomeDirectory(), h);
    EXPECT_EQ(user->libraryDirectory(), h / "Library/Quarn");
    EXPECT_EQ(user->userBaseDirectory(), h / "Containers");
    EXPECT_EQ(user->transientDirectory(), h / "Containers/Temp");
    EXPECT_EQ(user->stagingDirectory(), h / "Containers/Staging");
    for (const auto& p :
         {h / "Library/Quarn", h / "Containers", h / "Containers/Temp", h / "Containers/Staging"}) {
        expectDirectory(p, 501);
    }
    EXPECT_EQ(user->oldLoggingPath(), h / "Library/Logs/Quarn");
    EXPECT_EQ(user->systemContainerBackupBaseDirectory(), h / "Library/Backup/SystemContainers");
    EXPECT_EQ(user->systemContainerBackupDirectory(), h / "Library/Backup/SystemContainers/Data");
    EXPECT_EQ(user->systemGroupContainerBackupDirectory(),
              h / "Library/Backup/SystemContainers/Shared");
    for (const auto& p : {user->oldLoggingPath(), user->systemContainerBackupDirectory(),
                          user->systemGroupContainerBackupDirectory()}) {
        EXPECT_FALSE(statOf(p).exists) << p;
    }
}

TEST_F(QRNGlobalConfigurationTest, ContainerDirectoriesPerClass) {
    LogCapture log;
    auto& c = config();
    const auto containers = root_ / "/private/var/containers";
    const auto caches = root_ / "/private/var/root/Library/Caches/com.orvex.quarnd";
    const auto userBase = home() / "Containers";

    auto dir = c.containerDirectoryURLForUserIdentity(mobile(), 2, false);
    ASSERT_TRUE(dir);
    EXPECT_EQ(*dir, userBase / "Data/Application");
    expectDirectory(*dir, 501);
    dir = c.containerDirectoryURLForUserIdentity(mobile(), 7, true);
    EXPECT_EQ(*dir, userBase / "Temp/Shared/AppGroup");
    expectDirectory(*dir, 501);

    dir = c.containerDirectoryURLForUserIdentity(mobile(), 1, false);
    EXPECT_EQ(*dir, containers / "Bundle/Application");
    expectDirectory(*dir, 33);
    dir = c.containerDirectoryURLForUserIdentity(mobile(), 8, true);
    EXPECT_EQ(*dir, containers / "Temp/Bundle/Framework");
    expectDirectory(*dir, 33);
    dir = c.containerDirectoryURLForUserIdentity(mobile(), 12, false);
    EXPECT_EQ(*dir, containers / "Data/System");
    expectDirectory(*dir, 0);
    // Transient system containers live in the daemon's caches.
    dir = c.containerDirectoryURLForUserIdentity(mobile(), 13, true);
    EXPECT_EQ(*dir, caches / "Temp/Shared/SystemGroup");
    expectDirectory(*dir, 0);

    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(mobile(), 0, false));
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(mobile(), 14, false));
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(nullptr, 2, false));
    EXPECT_TRUE(log.contains("Invalid class for a per user container directory: 14"));

    // Each configuration answers only for its own kind of class.
    EXPECT_FALSE(c.globalContainerBaseURLWithContentClass(2, true));
    EXPECT_FALSE(c.globalContainerBaseURLWithContentClass(0, false));
    EXPECT_EQ(c.globalContainerBaseURLWithContentClass(5, false), containers / "Bundle/VPNPlugin");
    log.clear();
    EXPECT_FALSE(
        c.getPerUserConfigurationForUserIdentity(mobile())->containerDirectoryURLForContentClass(
            1, false));
    EXPECT_TRUE(log.contains("Invalid class for a per user container directory: 1"));
}

TEST_F(QRNGlobalConfigurationTest, StagingDirectoryPerClass) {
    auto& c = config();
    const auto global = c.stagingDirectory();
    const auto perUser = home() / "Containers/Staging";
    for (std::uint64_t cls = 0; cls <= 15; ++cls) {
        const bool user =
            cls == 2 || cls == 4 || cls == 6 || cls == 7 || cls == 9 || cls == 10 || cls == 11;
        EXPECT_EQ(c.stagingDirectoryURLForUserIdentity(mobile(), cls), user ? perUser : global)
            << cls;
    }
    EXPECT_FALSE(c.stagingDirectoryURLForUserIdentity(nullptr, 2));
}

// A directory that cannot be made is reported and its URL handed out anyway.
TEST_F(QRNGlobalConfigurationTest, CreationFailuresAreLoggedAndURLStillReturned) {
    LogCapture log;
    root_.writeFile("/private/var/containers", "not a directory");
    root_.writeFile("/private/var/mobile/Containers", "not a directory");
    auto& c = config();
    EXPECT_EQ(c.sharedContainersDirectory(), root_ / "/private/var/containers");
    EXPECT_TRUE(log.contains("Failed to create shared container dir at \"" +
                             (root_ / "/private/var/containers").string() + "\": "))
        << log.all();
    EXPECT_EQ(c.bundleDirectory(), root_ / "/private/var/containers/Bundle");
    EXPECT_TRUE(log.contains("Failed to create bundle dir at \""));
    auto dir = c.containerDirectoryURLForUserIdentity(mobile(), 2, false);
    EXPECT_EQ(*dir, home() / "Containers/Data/Application");
    EXPECT_TRUE(log.contains("Failed to create user base dir at \""));
    EXPECT_TRUE(log.contains("Failed to create container dir at \"" + dir->string() + "\": "));
}

TEST_F(QRNGlobalConfigurationTest, MigrationFilesAndInternalImage) {
    auto& c = config();
    EXPECT_FALSE(c.migrationFileExistsWithName("Migrated"));
    std::ofstream(c.libraryDirectory() / "Migrated") << "x";
    EXPECT_TRUE(c.migrationFileExistsWithName("Migrated"));
    // Only names directly inside the library directory are asked about.
    EXPECT_TRUE(std::filesystem::exists(c.libraryDirectory() / ".."));
    EXPECT_FALSE(c.migrationFileExistsWithName(".."));
    EXPECT_FALSE(c.migrationFileExistsWithName("../Quarn/Migrated"));
    EXPECT_FALSE(c.migrationFileExistsWithName(""));

    root_.writeFile("/etc/os-release", "ID=orvex\nVARIANT_ID=internal\n");
    EXPECT_TRUE(c.isInternalImage());
    root_.writeFile("/etc/os-release", "ID=orvex\n");
    EXPECT_TRUE(c.isInternalImage()); // computed once
    c.setIsInternalImage(false);
    EXPECT_FALSE(c.isInternalImage());
}

TEST_F(QRNGlobalConfigurationTest, ConcurrentFirstUseCreatesOnce) {
    std::vector<std::thread> threads;
    std::vector<std::filesystem::path> seen(8);
    for (std::size_t i = 0; i < seen.size(); ++i) {
        threads.emplace_back([&, i] {
            seen[i] = config().getPerUserConfigurationForUserIdentity(mobile())->stagingDirectory();
        });
    }
    for (auto& t : threads) {
        t.join();
    }
    for (const auto& p : seen) {
        EXPECT_EQ(p, home() / "Containers/Staging");
    }
    expectDirectory(home() / "Containers/Staging", 501);
}

TEST(QRNGlobalConfigurationNoMobile, MissingMobileAccountGivesZeroIds) {
    LogCapture log;
    TempRoot root(TempRoot::Options{.withMobileUser = false});
    auto& c = QRNGlobalConfiguration::sharedInstance();
    EXPECT_EQ(c.currentMobileUserId(), 0u);
    EXPECT_EQ(c.currentMobileGroupId(), 0u);
    EXPECT_TRUE(log.contains("Failed to get mobile uid. This is bad"));
    // Role uids never get an identity, so the default falls back to 501.
    auto def = QRNUserIdentitySharedCache::defaultUserIdentity();
    ASSERT_NE(def, nullptr);
    EXPECT_EQ(def->posixUID(), 501u);
}

TEST(QRNGlobalConfigurationMobile, MobileIdsAreRead) {
    LogCapture log;
    TempRoot root;
    EXPECT_EQ(QRNGlobalConfiguration::sharedInstance().currentMobileUserId(), 501u);
    EXPECT_EQ(QRNGlobalConfiguration::sharedInstance().currentMobileGroupId(), 501u);
    EXPECT_TRUE(log.contains("Current mobile user ID is 501, group ID is 501"));
}
