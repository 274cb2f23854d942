// The boot cleanup passes on a temporary root: what they send to death row,
// what they keep, what they log, and when their completions run.

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/support/Queue.h"
#include "Daemon/support/UUID.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <atomic>
#include <fstream>
#include <future>
#include <set>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

class BootCleanupTest : public test::TempRootTest {
protected:
    static QRNClientConnection& connection() {
        return QRNClientConnection::sharedClientConnection();
    }
    static QRNGlobalConfiguration& configuration() {
        return QRNGlobalConfiguration::sharedInstance();
    }
    static QRNUserIdentityPtr user() { return QRNUserIdentitySharedCache::defaultUserIdentity(); }
    static fs::path makeTree(const fs::path& directory) {
        fs::create_directories(directory / "inner");
        std::ofstream(directory / "inner" / "file") << "x";
        return directory;
    }
    // Every name parked on death row (one level below the unique directories).
    static std::set<std::string> namesOnDeathRow() {
        std::set<std::string> names;
        const fs::path deathrow = configuration().deathrowDirectory();
        if (!fs::exists(deathrow)) {
            return names;
        }
        for (const auto& unique : fs::directory_iterator(deathrow)) {
            for (const auto& item : fs::directory_iterator(unique.path())) {
                names.insert(item.path().filename().string());
            }
        }
        return names;
    }
    // Runs a pass to its end: the completion, then every queued block.
    template <class Start> static int runToEnd(Start start, std::function<void()> check = {}) {
        std::atomic<int> calls{0};
        std::promise<void> done;
        start([&] {
            if (check && calls == 0) {
                check();
            }
            if (++calls == 1) {
                done.set_value();
            }
        });
        done.get_future().wait();
        QRNClientConnection::_sharedBackgroundQueue()->sync([] {});
        QRNClientConnection::_sharedDeathrowBackgroundQueue()->sync([] {});
        return calls;
    }
    static int runBootCleanup(std::function<void()> check = {}) {
        return runToEnd(
            [](auto completion) { connection().quarnManagerCleanupWithCompletion(completion); },
            std::move(check));
    }
    static int runFirstBootCleanup(std::function<void()> check = {}) {
        return runToEnd(
            [](auto completion) {
                connection().rebootQuarnManagerCleanupWithCompletion(completion);
            },
            std::move(check));
    }
    static fs::path userStaging() {
        return *configuration().stagingDirectoryURLForUserIdentity(user(),
                                                                   kQRNContainerClassAppData);
    }
};

TEST_F(BootCleanupTest, StagingLeftoversAreDestroyedAndTheCompletionRunsOnceAfterThem) {
    const fs::path global = makeTree(configuration().stagingDirectory() / "global-leftover");
    const fs::path perUser = makeTree(userStaging() / "user-leftover");
    test::LogCapture log;
    const int calls = runBootCleanup([&] {
        EXPECT_FALSE(fs::exists(global)) << "completion ran before the moves";
        EXPECT_TRUE(namesOnDeathRow().empty()) << "completion ran before the deletion pass";
    });
    EXPECT_EQ(calls, 1);
    EXPECT_FALSE(fs::exists(global));
    EXPECT_FALSE(fs::exists(perUser));
    EXPECT_TRUE(namesOnDeathRow().empty());
    EXPECT_FALSE(log.contains("Failed to get items")) << log.all();
}

TEST_F(BootCleanupTest, MissingStagingIsSilentAndAnUnreadableOneDoesNotStopTheOthers) {
    const fs::path global = configuration().stagingDirectory();
    fs::path perUser = makeTree(userStaging() / "user-leftover");
    fs::remove_all(global);
    {
        test::LogCapture log;
        EXPECT_EQ(runBootCleanup(), 1);
        EXPECT_FALSE(log.contains("staging URL")) << log.all();
        EXPECT_FALSE(fs::exists(perUser));
    }
    // A file where the directory should be cannot be listed.
    std::ofstream(global) << "not a directory";
    perUser = makeTree(userStaging() / "user-leftover");
    test::LogCapture log;
    EXPECT_EQ(runBootCleanup(), 1);
    EXPECT_TRUE(log.contains("Failed to get items at global staging URL: " + global.string()))
        << log.all();
    EXPECT_FALSE(fs::exists(perUser)) << "the per-user staging was not cleaned";
    EXPECT_TRUE(fs::exists(global)) << "the unreadable item itself is left alone";
}

TEST_F(BootCleanupTest, FirstBootCleanupSentencesTransientDataAndOrphansButKeepsContainers) {
    auto identity = QRNContainerIdentity::containerIdentityWithUserIdentity(
        user(), "com.example.kept", kQRNContainerClassAppData);
    ASSERT_TRUE(identity);
    auto kept =
        connection().createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
    ASSERT_TRUE(kept);
    const fs::path classDirectory = *configuration().containerDirectoryURLForUserIdentity(
        user(), kQRNContainerClassAppData, false);
    const std::string orphanName = UUID::random().string();
    const fs::path orphan = makeTree(classDirectory / orphanName);
    const fs::path junk = makeTree(classDirectory / "not-a-uuid");
    makeTree(configuration().transientDirectory() / "old-system-transient");
    makeTree(configuration().transientBundleDirectory() / "old-bundle-transient");
    auto perUser = configuration().getPerUserConfigurationForUserIdentity(user());
    makeTree(perUser->transientDirectory() / "old-user-transient");

    test::LogCapture log;
    const int calls = runFirstBootCleanup(
        [&] { EXPECT_FALSE(fs::exists(orphan)) << "completion ran before the orphan pass"; });
    EXPECT_EQ(calls, 1);
    EXPECT_TRUE(fs::exists((*kept)->url() / QRNMetadata::kFileName));
    EXPECT_FALSE(fs::exists(junk));
    EXPECT_FALSE(fs::exists(configuration().transientDirectory()));
    EXPECT_FALSE(fs::exists(configuration().transientBundleDirectory()));
    EXPECT_FALSE(fs::exists(perUser->transientDirectory()));
    const std::set<std::string> parked = namesOnDeathRow();
    for (const std::string& name : {orphanName, std::string("not-a-uuid"), std::string("Temp")}) {
        EXPECT_TRUE(parked.count(name)) << name << " not on death row";
    }
    EXPECT_EQ(parked.count((*kept)->url().filename().string()), 0u);
    EXPECT_EQ(log.count("Deleting orphaned data missing a metadata file at: "), 1u)
        << "only the UUID-named orphan is reported so; " << log.all();
    EXPECT_FALSE(log.contains("Failed to")) << log.all();

    // The next boot cleanup destroys what the first-boot one parked.
    EXPECT_EQ(runBootCleanup(), 1);
    EXPECT_TRUE(namesOnDeathRow().empty());
}

TEST_F(BootCleanupTest, OrphanPassSkipsVanishedEntriesAndExplainsOnInternalBuilds) {
    configuration().setIsInternalImage(true);
    const fs::path classDirectory = *configuration().containerDirectoryURLForUserIdentity(
        user(), kQRNContainerClassAppGroup, false);
    const fs::path orphan = makeTree(classDirectory / UUID::random().string());
    const fs::path gone = classDirectory / UUID::random().string();
    test::LogCapture log;
    connection()._cleanupOrphanedDataForDirectories({gone, orphan}, kQRNContainerClassAppGroup);
    EXPECT_TRUE(
        log.contains("Ignoring deleted container path during cleanup: [" + gone.string() + "]"));
    EXPECT_TRUE(log.contains("Here are the invalid files:"));
    EXPECT_TRUE(log.contains("***END INTERNAL BUILD REQUEST"));
    EXPECT_FALSE(fs::exists(orphan));
}

} // namespace
