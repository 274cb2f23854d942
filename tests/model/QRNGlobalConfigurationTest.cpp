#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/xattr.h>

#include <fstream>

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
    using C = QRNGlobalConfiguration;
    struct Dir {
        const std::filesystem::path& (C::*get)();
        const char* path;
        uid_t owner;
        const char* protectionClass; // the daemon's own stay readable when locked
    };
    const Dir dirs[] = {
        {&C::sharedContainersDirectory, "/private/var/containers", 0, ""},
        {&C::logDirectory, "/private/var/root/Library/Logs/Quarn", 0, "4"},
        {&C::cachesDirectory, "/private/var/root/Library/Caches/com.orvex.quarnd", 0, "4"},
        {&C::libraryDirectory, "/private/var/root/Library/Quarn", 0, "4"},
        {&C::transientDirectory, "/private/var/root/Library/Caches/com.orvex.quarnd/Temp", 0, ""},
        // Bundles are installed by the installer, which owns their transient home.
        {&C::transientBundleDirectory, "/private/var/containers/Temp", 33, ""},
        {&C::stagingDirectory, "/private/var/root/Library/Caches/com.orvex.quarnd/Staging", 0, ""},
        {&C::deathrowDirectory, "/private/var/root/Library/Caches/com.orvex.quarnd/Dead", 0, ""},
        {&C::replaceDirectory, "/private/var/root/Library/Quarn/Replace", 0, ""},
        {&C::pendingUpdatesDirectory, "/private/var/root/Library/Quarn/PendingUpdates", 0, ""},
        {&C::bundleDirectory, "/private/var/containers/Bundle", 0, ""},
    };
    for (const auto& d : dirs) {
        EXPECT_EQ((config().*d.get)(), root_ / d.path);
        expectDirectory(root_ / d.path, d.owner);
        EXPECT_EQ(protectionClassOf(root_ / d.path), d.protectionClass) << d.path;
    }
    EXPECT_EQ(config().legacyTransientBundleDirectory(),
              root_ / "/private/var/installer/Library/Caches/com.orvex.quarnd");
    EXPECT_FALSE(statOf(config().legacyTransientBundleDirectory()).exists);
}

TEST_F(QRNGlobalConfigurationTest, PerUserDirectoriesBelongToTheUser) {
    auto user = config().getPerUserConfigurationForUserIdentity(mobile());
    ASSERT_NE(user, nullptr);
    EXPECT_EQ(user, config().getPerUserConfigurationForUserIdentity(mobile()));
    EXPECT_EQ(user->userHomeDirectory(), home());
    using P = QRNPerUserConfiguration;
    const std::tuple<const std::filesystem::path& (P::*)(), const char*, bool> dirs[] = {
        {&P::libraryDirectory, "Library/Quarn", true},
        {&P::userBaseDirectory, "Containers", true},
        {&P::transientDirectory, "Containers/Temp", true},
        {&P::stagingDirectory, "Containers/Staging", true},
        {&P::oldLoggingPath, "Library/Logs/Quarn", false},
        {&P::systemContainerBackupBaseDirectory, "Library/Backup/SystemContainers", false},
        {&P::systemContainerBackupDirectory, "Library/Backup/SystemContainers/Data", false},
        {&P::systemGroupContainerBackupDirectory, "Library/Backup/SystemContainers/Shared", false},
    };
    for (const auto& [get, path, created] : dirs) {
        EXPECT_EQ(((*user).*get)(), home() / path);
        if (created) {
            expectDirectory(home() / path, 501);
        } else {
            EXPECT_FALSE(statOf(home() / path).exists) << path;
        }
    }
}

TEST_F(QRNGlobalConfigurationTest, ContainerDirectoriesPerClass) {
    LogCapture log;
    auto& c = config();
    const std::string containers = "/private/var/containers/";
    const std::tuple<std::uint64_t, bool, std::string, uid_t> dirs[] = {
        {2, false, home() / "Containers/Data/Application", 501},
        {7, true, home() / "Containers/Temp/Shared/AppGroup", 501},
        {1, false, root_ / (containers + "Bundle/Application"), 33},
        {8, true, root_ / (containers + "Temp/Bundle/Framework"), 33},
        {12, false, root_ / (containers + "Data/System"), 0},
        // Transient system containers live in the daemon's caches.
        {13, true,
         root_ / "/private/var/root/Library/Caches/com.orvex.quarnd/Temp/Shared/SystemGroup", 0},
    };
    for (const auto& [cls, transient, path, owner] : dirs) {
        EXPECT_EQ(c.containerDirectoryURLForUserIdentity(mobile(), cls, transient),
                  std::filesystem::path(path));
        expectDirectory(path, owner);
    }
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(mobile(), 0, false));
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(mobile(), 14, false));
    EXPECT_FALSE(c.containerDirectoryURLForUserIdentity(nullptr, 2, false));
    EXPECT_TRUE(log.contains("Invalid class for a per user container directory: 14"));

    // Each configuration answers only for its own kind of class.
    EXPECT_FALSE(c.globalContainerBaseURLWithContentClass(2, true));
    EXPECT_FALSE(c.globalContainerBaseURLWithContentClass(0, false));
    EXPECT_EQ(c.globalContainerBaseURLWithContentClass(5, false),
              root_ / (containers + "Bundle/VPNPlugin"));
    log.clear();
    EXPECT_FALSE(
        c.getPerUserConfigurationForUserIdentity(mobile())->containerDirectoryURLForContentClass(
            1, false));
    EXPECT_TRUE(log.contains("Invalid class for a per user container directory: 1"));

    // Per-user classes stage in the user's home, all others globally.
    for (std::uint64_t cls = 0; cls <= 15; ++cls) {
        const bool user =
            cls == 2 || cls == 4 || cls == 6 || cls == 7 || cls == 9 || cls == 10 || cls == 11;
        EXPECT_EQ(c.stagingDirectoryURLForUserIdentity(mobile(), cls),
                  user ? home() / "Containers/Staging" : c.stagingDirectory())
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

TEST(QRNGlobalConfigurationMobile, MobileIdsAreReadOrZeroWithoutTheAccount) {
    LogCapture log;
    for (bool withMobileUser : {true, false}) {
        SCOPED_TRACE(withMobileUser);
        TempRoot root(TempRoot::Options{.withMobileUser = withMobileUser});
        auto& c = QRNGlobalConfiguration::sharedInstance();
        EXPECT_EQ(c.currentMobileUserId(), withMobileUser ? 501u : 0u);
        EXPECT_EQ(c.currentMobileGroupId(), withMobileUser ? 501u : 0u);
        EXPECT_TRUE(log.contains(withMobileUser ? "Current mobile user ID is 501, group ID is 501"
                                                : "Failed to get mobile uid. This is bad"));
        // Role uids never get an identity, so the default falls back to 501.
        EXPECT_EQ(QRNUserIdentitySharedCache::defaultUserIdentity()->posixUID(), 501u);
    }
}
