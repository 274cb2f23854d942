// First-boot setup on a temporary root: system containers restored from a
// backup are merged into the live containers of their identifiers.

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/support/Queue.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

class BootSetupTest : public test::TempRootTest {
protected:
    BootSetupTest()
        : perUser_(QRNGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserIdentity(
              QRNUserIdentitySharedCache::sharedCache().userIdentityForCurrentContext())) {}
    ~BootSetupTest() override {
        // Moves to death row may have started deletion passes.
        QRNClientConnection::_sharedDeathrowBackgroundQueue()->sync([] {});
    }

    static QRNClientConnection& connection() {
        return QRNClientConnection::sharedClientConnection();
    }
    static void write(const fs::path& file, const std::string& contents) {
        fs::create_directories(file.parent_path());
        std::ofstream(file) << contents;
    }
    static std::string read(const fs::path& file) {
        std::ifstream in(file);
        std::stringstream contents;
        contents << in.rdbuf();
        return contents.str();
    }
    static fs::path liveContainer(const std::string& identifier, std::uint64_t cls) {
        auto identity = QRNContainerIdentity::containerIdentityWithIdentifier(identifier, cls);
        EXPECT_TRUE(identity);
        auto found =
            connection().createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
        EXPECT_TRUE(found) << "code " << (found ? 1 : found.error());
        return found ? (*found)->url() : fs::path();
    }
    fs::path backupBase() const { return perUser_->systemContainerBackupBaseDirectory(); }
    fs::path dataBackup() const { return perUser_->systemContainerBackupDirectory(); }
    fs::path groupBackup() const { return perUser_->systemGroupContainerBackupDirectory(); }

    std::shared_ptr<QRNPerUserConfiguration> perUser_;
};

TEST_F(BootSetupTest, RestoredContainersAreMergedIntoTheLiveOnesAndTheBackupRemoved) {
    const fs::path existing = liveContainer("com.example.sysd", kQRNContainerClassSystemData);
    write(existing / "settings.plist", "old");
    write(existing / "local-only", "stays");
    write(dataBackup() / "com.example.sysd" / "settings.plist", "restored");
    write(dataBackup() / "com.example.sysd" / "Library" / "Preferences" / "p.plist", "prefs");
    write(dataBackup() / "com.example.sysd" / QRNMetadata::kFileName, "not metadata");
    write(groupBackup() / "systemgroup.com.example.shared" / "shared.db", "group");

    test::LogCapture log;
    connection().rebootQuarnManagerSetup();

    EXPECT_EQ(read(existing / "settings.plist"), "restored");
    EXPECT_EQ(read(existing / "local-only"), "stays");
    EXPECT_EQ(read(existing / "Library" / "Preferences" / "p.plist"), "prefs");
    EXPECT_TRUE(fs::is_directory(existing / "Library" / "Caches")) << "structure not recreated";
    EXPECT_NE(read(existing / QRNMetadata::kFileName), "not metadata");
    EXPECT_EQ(liveContainer("com.example.sysd", kQRNContainerClassSystemData), existing);
    const fs::path group =
        liveContainer("systemgroup.com.example.shared", kQRNContainerClassSystemGroup);
    EXPECT_EQ(read(group / "shared.db"), "group");
    EXPECT_TRUE(log.contains("Installing system containers"));
    EXPECT_TRUE(log.contains("Installing system group containers"));
    EXPECT_TRUE(log.contains("Restoring container for com.example.sysd at "));
    EXPECT_FALSE(log.contains("Error processing")) << log.all();
    EXPECT_FALSE(fs::exists(backupBase())) << "not an internal build: the backup goes";
}

TEST_F(BootSetupTest, AnItemThatCannotBeMergedIsSetAsideAndTheOthersStillInstalled) {
    QRNGlobalConfiguration::sharedInstance().setIsInternalImage(true);
    write(dataBackup() / "com.example.broken", "a file, not a container");
    write(dataBackup() / "com.example.fine" / "data", "fine");
    // A stale "inprogress" from a start cut short is replaced.
    write(fs::path(dataBackup().string() + ".inprogress") / "com.example.stale" / "x", "stale");

    test::LogCapture log;
    connection().rebootQuarnManagerSetup();

    EXPECT_TRUE(log.contains("Error processing restored system container")) << log.all();
    EXPECT_EQ(read(backupBase() / "Data.failed" / "com.example.broken"), "a file, not a container");
    EXPECT_EQ(read(liveContainer("com.example.fine", kQRNContainerClassSystemData) / "data"),
              "fine");
    EXPECT_FALSE(fs::exists(backupBase() / "Data.inprogress" / "com.example.stale"));
    EXPECT_FALSE(fs::exists(dataBackup()));
    EXPECT_TRUE(fs::exists(backupBase())) << "internal builds keep the backup for inspection";
}

TEST_F(BootSetupTest, WithoutBackupsNothingIsMadeOrInstalled) {
    QRNGlobalConfiguration::sharedInstance().setIsInternalImage(true);
    test::LogCapture log;
    connection().rebootQuarnManagerSetup();
    connection().quarnManagerSetup();
    EXPECT_FALSE(fs::exists(backupBase()));
    EXPECT_FALSE(log.contains("Installing")) << log.all();
}

} // namespace
