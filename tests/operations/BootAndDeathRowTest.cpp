// Death row and the boot passes on a temporary root: how items are parked
// and destroyed, what the boot cleanups sentence and keep, and how restored
// system containers are merged at first boot.

#include "CreateFixture.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/platform/SandboxKernel.h"
#include "Daemon/support/ProcessTransaction.h"
#include "Daemon/support/UUID.h"

#include <gmock/gmock.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>

#include <atomic>
#include <future>
#include <map>

using namespace quarn;
using namespace quarn::test;
namespace fs = std::filesystem;

namespace {

std::size_t entriesIn(const fs::path& directory) {
    return fs::exists(directory) ? std::distance(fs::directory_iterator(directory), {}) : 0;
}

std::string read(const fs::path& file) {
    std::ifstream in(file);
    return {std::istreambuf_iterator<char>(in), {}};
}

void write(const fs::path& file, const std::string& contents) {
    fs::create_directories(file.parent_path());
    std::ofstream(file) << contents;
}

class DeathRowTest : public CreateFixture {
protected:
    DeathRowTest() : CreateFixture(false) {}

    fs::path makeFile(const std::string& absolute) {
        root_.writeFile(absolute, absolute);
        return root_ / absolute;
    }
    // Runs one pass to its end and answers its error; notes the open
    // transactions while its completion runs.
    std::optional<Error> runPass() {
        std::promise<std::optional<Error>> done;
        shared().deleteContainersOnDeathRowWithCompletion([&](std::optional<Error> error) {
            transactionsInCompletion_ = ProcessTransaction::count();
            done.set_value(std::move(error));
        });
        std::optional<Error> error = done.get_future().get();
        drainBackground();
        return error;
    }
    // Runs a boot cleanup to its end: the completion, then every queued
    // block; `check` runs inside the completion. Answers the completion count.
    static int runCleanup(
        bool firstBoot, std::function<void()> check = [] {}) {
        std::atomic<int> calls{0};
        std::promise<void> done;
        auto completion = [&] {
            if (++calls == 1) {
                check();
                done.set_value();
            }
        };
        if (firstBoot) {
            shared().rebootQuarnManagerCleanupWithCompletion(completion);
        } else {
            shared().quarnManagerCleanupWithCompletion(completion);
        }
        done.get_future().wait();
        drainBackground();
        return calls;
    }
    std::size_t transactionsInCompletion_ = 0;
};

TEST_F(DeathRowTest, ItemsAreParkedApartAndPassesDestroyThemOrSetThemAside) {
    fs::remove(deathRow());
    EXPECT_FALSE(runPass().has_value()) << "a missing death row is nothing to do";
    fs::create_directories(deathRow());
    fs::create_directories(root_ / "/tmp");
    const std::size_t open = ProcessTransaction::count();
    QRNClientConnection::_sharedDeathrowBackgroundQueue()
        ->suspend(); // passes wait, so death row can be looked at
    EXPECT_TRUE(shared()._moveItemAtURLToDeathRow(root_ / "/private/var/gone", true, true));
    EXPECT_EQ(entriesIn(deathRow()), 0u) << "no unique directory is left for a missing item";
    EXPECT_EQ(ProcessTransaction::count(), open) << "a missing item started a pass";

    // Same last component from two places, at once.
    fs::path a = makeFile("/private/var/a/Data");
    fs::path b = makeFile("/private/var/b/Data");
    auto moveA = std::async(std::launch::async,
                            [&] { return shared()._moveItemAtURLToDeathRow(a, false, false); });
    EXPECT_TRUE(shared()._moveItemAtURLToDeathRow(b, false, true));
    EXPECT_TRUE(moveA.get());
    EXPECT_EQ(ProcessTransaction::count(), open + 1) << "one pass wanted";
    const std::vector<std::string> uniques = namesIn(deathRow());
    EXPECT_EQ(uniques.size(), 2u);
    for (const std::string& unique : uniques) {
        EXPECT_EQ(unique.rfind("temp.", 0), 0u) << unique;
        EXPECT_TRUE(fs::exists(deathRow() / unique / "Data"));
    }
    EXPECT_FALSE(fs::exists(a) || fs::exists(b));
    QRNClientConnection::_sharedDeathrowBackgroundQueue()->resume();
    drainBackground();
    EXPECT_EQ(ProcessTransaction::count(), open);
    EXPECT_EQ(entriesIn(deathRow()), 0u) << "the pass destroyed everything parked";

    // Immutable files are destroyed too, where the file system has the flag,
    // and a pass's transaction stays open through its completion.
    fs::path pinned = makeFile("/private/var/locked/Library/pinned");
    int fd = ::open(pinned.c_str(), O_RDONLY | O_CLOEXEC);
    int flags = 0;
    if (fd >= 0 && ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0) {
        flags |= FS_IMMUTABLE_FL;
        (void)::ioctl(fd, FS_IOC_SETFLAGS, &flags);
    }
    ::close(fd);
    ASSERT_TRUE(shared()._moveItemAtURLToDeathRow(root_ / "/private/var/locked", true, false));
    EXPECT_FALSE(runPass().has_value());
    EXPECT_EQ(transactionsInCompletion_, open + 1);
    EXPECT_EQ(ProcessTransaction::count(), open);
    EXPECT_EQ(entriesIn(deathRow()), 0u);
    EXPECT_EQ(entriesIn(root_ / "/tmp"), 0u) << "destroyed, not moved aside";

    // Nothing can be unlinked, and the first move aside fails too: the pass
    // goes on after the failure and reports it.
    for (std::string dir : {"/private/var/one", "/private/var/two"}) {
        makeFile(dir + "/file");
        ASSERT_TRUE(shared()._moveItemAtURLToDeathRow(root_ / dir, true, false));
    }
    env_->failCallsFrom(EnvCall::Unlink, 1, EBUSY);
    env_->failCall(EnvCall::Rename, 1, EIO);
    std::optional<Error> error = runPass();
    env_->clearFailures();
    ASSERT_TRUE(error.has_value());
    EXPECT_TRUE(error->isQRN(kQRNErrorDestroyFailed));
    EXPECT_EQ(entriesIn(deathRow()), 1u) << "the failed item stays on death row";
    EXPECT_EQ(entriesIn(root_ / "/tmp"), 1u) << "the other went to /tmp below the root";
    EXPECT_FALSE(runPass().has_value());
    EXPECT_EQ(entriesIn(deathRow()), 0u);
}

TEST_F(DeathRowTest, SystemContainersGetNewDirectoriesExceptWellKnownAndAnalytics) {
    auto cachedNow = [](const QRNMetadataPtr& metadata) {
        auto found = QRNContainerCache::sharedInstance().containerForContainerIdentity(
            metadata->containerIdentity());
        return found ? *found : nullptr;
    };
    // Identifier -> whether its directory must stay.
    const std::map<std::string, bool> kept = {
        {"com.example.systemd", false},
        {"com.orvex.devicesettings", true},
        {"systemgroup.com.example.shared", false},
        {"systemgroup.com.orvex.deviceprofiles", true},
        {"systemgroup.com.orvex.osanalytics", true},
    };
    std::map<std::string, QRNMetadataPtr> before;
    for (const auto& [identifier, keep] : kept) {
        before[identifier] = create(identifier, identifier.starts_with("systemgroup.")
                                                    ? kQRNContainerClassSystemGroup
                                                    : kQRNContainerClassSystemData);
        ASSERT_TRUE(before[identifier]);
    }
    shared()._regenerateAllSystemContainerPaths();

    for (const auto& [identifier, old] : before) {
        QRNMetadataPtr now = cachedNow(old);
        ASSERT_TRUE(now) << identifier;
        EXPECT_EQ(now->url() == old->url(), kept.at(identifier)) << identifier;
        EXPECT_EQ(fs::exists(old->url()), kept.at(identifier)) << identifier;
        EXPECT_TRUE(fs::exists(now->url() / QRNMetadata::kFileName)) << identifier;
        EXPECT_EQ(now->url().parent_path(), old->url().parent_path());
    }
    // The sandbox follows the system data container to its new directory.
    std::string mapped;
    root_.context().instance<SandboxKernel>().forEachItem(0, [&](const SandboxItem& item) {
        mapped = item.identifier == "com.example.systemd" ? item.path : mapped;
        return true;
    });
    EXPECT_EQ(mapped, cachedNow(before["com.example.systemd"])->url().string());
    // A cache rebuilt from disk finds every container where it now is.
    QRNContainerCache::sharedInstance().invalidateUserIdentity(user());
    for (const auto& [identifier, old] : before) {
        EXPECT_TRUE(cachedNow(old)) << identifier;
    }
}

TEST_F(DeathRowTest, StagingLeftoversAreDestroyedBeforeTheCompletionWhateverTheGlobalOneIs) {
    const fs::path global = configuration().stagingDirectory();
    const fs::path leftover = makeTree(global / "global-leftover");
    const fs::path perUser = stagingDirectory(kQRNContainerClassAppData) / "leftover";
    for (const std::string state : {"holding leftovers", "missing", "a file"}) {
        SCOPED_TRACE(state);
        const bool unreadable = state == "a file";
        if (unreadable) {
            std::ofstream(global) << "not a directory";
        }
        makeTree(perUser);
        LogCapture log;
        EXPECT_EQ(runCleanup(false,
                             [&] {
                                 EXPECT_FALSE(fs::exists(leftover)) << "completion before moves";
                                 EXPECT_TRUE(namesOnDeathRow().empty())
                                     << "completion ran before the deletion pass";
                             }),
                  1);
        EXPECT_FALSE(fs::exists(perUser)) << "the per-user staging was not cleaned";
        EXPECT_EQ(log.contains(unreadable
                                   ? "Failed to get items at global staging URL: " + global.string()
                                   : std::string("staging URL")),
                  unreadable)
            << log.all();
        if (!unreadable) {
            fs::remove_all(global);
        }
    }
    EXPECT_TRUE(fs::exists(global)) << "the unreadable item itself is left alone";
}

TEST_F(DeathRowTest, FirstBootCleanupSentencesTransientDataAndOrphansButKeepsContainers) {
    // The daemon's own connection may make any identifier's container.
    auto made = shared().createOrLookupContainerWithContainerIdentity(
        identity("com.example.kept", kQRNContainerClassAppData), true, false, true);
    ASSERT_TRUE(made.has_value()) << made.error();
    const QRNMetadataPtr kept = *made;
    const std::string orphanName = UUID::random().string();
    const fs::path orphan = makeTree(classDirectory(kQRNContainerClassAppData) / orphanName);
    const fs::path junk = makeTree(classDirectory(kQRNContainerClassAppData) / "not-a-uuid");
    makeTree(configuration().transientDirectory() / "old-system-transient");
    makeTree(configuration().transientBundleDirectory() / "old-bundle-transient");
    auto perUser = configuration().getPerUserConfigurationForUserIdentity(user());
    makeTree(perUser->transientDirectory() / "old-user-transient");

    EXPECT_EQ(runCleanup(true, [&] { EXPECT_FALSE(fs::exists(orphan)) << "completion first"; }), 1);
    EXPECT_TRUE(fs::exists(kept->url() / QRNMetadata::kFileName));
    for (const fs::path& gone :
         {junk, configuration().transientDirectory(), configuration().transientBundleDirectory(),
          perUser->transientDirectory()}) {
        EXPECT_FALSE(fs::exists(gone)) << gone;
    }
    const std::vector<std::string> parked = namesOnDeathRow();
    EXPECT_THAT(parked, ::testing::IsSupersetOf(
                            {orphanName, std::string("not-a-uuid"), std::string("Temp")}));
    EXPECT_THAT(parked, ::testing::Not(::testing::Contains(kept->url().filename().string())));

    // The next boot cleanup destroys what the first-boot one parked.
    EXPECT_EQ(runCleanup(false), 1);
    EXPECT_TRUE(namesOnDeathRow().empty());

    // The orphan pass skips entries gone since the listing, and explains
    // itself on internal builds.
    configuration().setIsInternalImage(true);
    const fs::path groupOrphan =
        makeTree(classDirectory(kQRNContainerClassAppGroup) / UUID::random().string());
    auto listing = QRNFileManager::defaultManager().listDirectoryAtURL(
        classDirectory(kQRNContainerClassAppGroup));
    ASSERT_TRUE(listing);
    listing->items.insert(listing->items.begin(),
                          {classDirectory(kQRNContainerClassAppGroup) / UUID::random().string()});
    LogCapture log;
    shared()._cleanupOrphanedDataForDirectories(*listing, kQRNContainerClassAppGroup);
    EXPECT_TRUE(log.contains("Here are the invalid files:")) << log.all();
    EXPECT_FALSE(fs::exists(groupOrphan));
}

// First-boot setup: system containers restored from a backup are merged
// into the live containers of their identifiers.
TEST_F(DeathRowTest, BootSetupMergesRestoredContainersIntoTheLiveOnesAndSetsAsideTheRest) {
    auto live = [this](const std::string& identifier, std::uint64_t cls) {
        QRNMetadataPtr made = create(identifier, cls);
        return made ? made->url() : fs::path();
    };
    auto perUser = configuration().getPerUserConfigurationForUserIdentity(user());
    const fs::path backupBase = perUser->systemContainerBackupBaseDirectory();
    const fs::path dataBackup = perUser->systemContainerBackupDirectory();
    // Internal builds keep a backup they made, so nothing must be made here.
    configuration().setIsInternalImage(true);
    shared().rebootQuarnManagerSetup();
    shared().quarnManagerSetup();
    EXPECT_FALSE(fs::exists(backupBase)) << "made without a backup";
    configuration().setIsInternalImage(false);
    const fs::path existing = live("com.example.sysd", kQRNContainerClassSystemData);
    write(existing / "settings.plist", "old");
    write(existing / "local-only", "stays");
    write(dataBackup / "com.example.sysd" / "settings.plist", "restored");
    write(dataBackup / "com.example.sysd" / "Library" / "Preferences" / "p.plist", "prefs");
    write(dataBackup / "com.example.sysd" / QRNMetadata::kFileName, "not metadata");
    write(perUser->systemGroupContainerBackupDirectory() / "systemgroup.com.example.shared" /
              "shared.db",
          "group");

    shared().rebootQuarnManagerSetup();
    EXPECT_EQ(read(existing / "settings.plist"), "restored");
    EXPECT_EQ(read(existing / "local-only"), "stays");
    EXPECT_EQ(read(existing / "Library" / "Preferences" / "p.plist"), "prefs");
    EXPECT_TRUE(fs::is_directory(existing / "Library" / "Caches")) << "structure not recreated";
    EXPECT_NE(read(existing / QRNMetadata::kFileName), "not metadata");
    EXPECT_EQ(live("com.example.sysd", kQRNContainerClassSystemData), existing);
    EXPECT_EQ(
        read(live("systemgroup.com.example.shared", kQRNContainerClassSystemGroup) / "shared.db"),
        "group");
    EXPECT_FALSE(fs::exists(backupBase)) << "not an internal build: the backup goes";

    // An item that cannot be merged is set aside and the others still installed.
    configuration().setIsInternalImage(true);
    write(dataBackup / "com.example.broken", "a file, not a container");
    write(dataBackup / "com.example.fine" / "data", "fine");
    // A stale "inprogress" from a start cut short is replaced.
    write(fs::path(dataBackup.string() + ".inprogress") / "com.example.stale" / "x", "stale");
    shared().rebootQuarnManagerSetup();
    EXPECT_EQ(read(backupBase / "Data.failed" / "com.example.broken"), "a file, not a container");
    EXPECT_EQ(read(live("com.example.fine", kQRNContainerClassSystemData) / "data"), "fine");
    EXPECT_FALSE(fs::exists(backupBase / "Data.inprogress" / "com.example.stale"));
    EXPECT_FALSE(fs::exists(dataBackup));
    EXPECT_TRUE(fs::exists(backupBase)) << "internal builds keep the backup for inspection";
}

} // namespace
