#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/platform/SandboxKernel.h"
#include "Daemon/support/ProcessTransaction.h"
#include "Daemon/support/Queue.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <map>
#include <set>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

std::size_t entriesIn(const fs::path& directory) {
    return fs::exists(directory) ? std::distance(fs::directory_iterator(directory), {}) : 0;
}

class DeathRowTest : public ::testing::Test {
protected:
    DeathRowTest() : env_(std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>())) {
        // Before anything makes the file manager, which takes the Env once.
        root_.context().install<Env>(env_);
    }
    ~DeathRowTest() override {
        env_->clearFailures();
        background()->sync([] {});
    }

    static std::shared_ptr<Queue> background() {
        return QRNClientConnection::_sharedDeathrowBackgroundQueue();
    }
    static QRNClientConnection& connection() {
        return QRNClientConnection::sharedClientConnection();
    }
    static fs::path deathRow() {
        return QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
    }
    fs::path makeFile(const std::string& absolute) {
        root_.writeFile(absolute, absolute);
        return root_ / absolute;
    }
    // Runs one pass to its end (transaction closed) and answers its error.
    static std::optional<Error> runPass() {
        std::promise<std::optional<Error>> done;
        connection().deleteContainersOnDeathRowWithCompletion(
            [&done](std::optional<Error> error) { done.set_value(std::move(error)); });
        std::optional<Error> error = done.get_future().get();
        background()->sync([] {});
        return error;
    }

    test::TempRoot root_;
    std::shared_ptr<FaultInjectingEnv> env_;
};

TEST_F(DeathRowTest, MovesParkEachItemInItsOwnDirectoryAndMissingItemsStartNothing) {
    const std::size_t open = ProcessTransaction::count();
    background()->suspend(); // passes wait, so death row can be looked at
    EXPECT_TRUE(connection()._moveItemAtURLToDeathRow(root_ / "/private/var/gone", true, true));
    EXPECT_EQ(entriesIn(deathRow()), 0u) << "no unique directory is left for a missing item";
    EXPECT_EQ(ProcessTransaction::count(), open) << "a missing item started a pass";

    // Same last component from two places, at once.
    fs::path a = makeFile("/private/var/a/Data");
    fs::path b = makeFile("/private/var/b/Data");
    auto moveA = std::async(std::launch::async,
                            [&] { return connection()._moveItemAtURLToDeathRow(a, false, false); });
    EXPECT_TRUE(connection()._moveItemAtURLToDeathRow(b, false, true));
    EXPECT_TRUE(moveA.get());
    EXPECT_EQ(ProcessTransaction::count(), open + 1) << "one pass wanted";
    std::set<std::string> uniques;
    for (const auto& unique : fs::directory_iterator(deathRow())) {
        EXPECT_EQ(unique.path().filename().string().rfind("temp.", 0), 0u) << unique.path();
        EXPECT_TRUE(fs::exists(unique.path() / "Data"));
        uniques.insert(unique.path().filename().string());
    }
    EXPECT_EQ(uniques.size(), 2u);
    EXPECT_FALSE(fs::exists(a) || fs::exists(b));

    background()->resume();
    background()->sync([] {});
    EXPECT_EQ(ProcessTransaction::count(), open);
    EXPECT_EQ(entriesIn(deathRow()), 0u) << "the pass destroyed everything parked";
}

TEST_F(DeathRowTest, PassDestroysImmutableFilesAndClosesItsTransactionAfterTheCompletion) {
    fs::path file = makeFile("/private/var/locked/Library/pinned");
    int fd = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    int flags = 0;
    bool immutable = ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
    flags |= FS_IMMUTABLE_FL;
    immutable = immutable && ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
    const int setError = errno;
    ::close(fd);
    if (!immutable) {
        GTEST_SKIP() << "this file system refuses the immutable flag: " << std::strerror(setError);
    }
    ASSERT_TRUE(connection()._moveItemAtURLToDeathRow(root_ / "/private/var/locked", true, false));

    const std::size_t open = ProcessTransaction::count();
    std::promise<std::size_t> openDuringCompletion;
    connection().deleteContainersOnDeathRowWithCompletion([&](std::optional<Error> error) {
        EXPECT_FALSE(error.has_value()) << error->description();
        openDuringCompletion.set_value(ProcessTransaction::count());
    });
    EXPECT_EQ(openDuringCompletion.get_future().get(), open + 1);
    background()->sync([] {});
    EXPECT_EQ(ProcessTransaction::count(), open);
    EXPECT_EQ(entriesIn(deathRow()), 0u);
    EXPECT_EQ(entriesIn(root_ / "/tmp"), 0u) << "destroyed, not moved aside";
}

TEST_F(DeathRowTest, PassMovesUndeletableItemsToTmpAndGoesOnAfterAFailure) {
    fs::remove(deathRow());
    EXPECT_FALSE(runPass().has_value()) << "a missing death row is nothing to do";
    fs::create_directories(deathRow());
    fs::create_directories(root_ / "/tmp");
    for (std::string dir : {"/private/var/one", "/private/var/two"}) {
        makeFile(dir + "/file");
        ASSERT_TRUE(connection()._moveItemAtURLToDeathRow(root_ / dir, true, false));
    }
    // Nothing can be unlinked, and the first move aside fails too.
    env_->failCallsFrom(EnvCall::Unlink, 1, EBUSY);
    env_->failCall(EnvCall::Rename, 1, EIO);
    test::LogCapture log;
    std::optional<Error> error = runPass();
    env_->clearFailures();

    ASSERT_TRUE(error.has_value());
    EXPECT_TRUE(error->isQRN(kQRNErrorDestroyFailed));
    EXPECT_EQ(log.count("Failed to destroy item at:"), 1u) << log.all();
    EXPECT_EQ(entriesIn(deathRow()), 1u) << "the failed item stays on death row";
    EXPECT_EQ(entriesIn(root_ / "/tmp"), 1u) << "the other went to /tmp below the root";
    EXPECT_FALSE(runPass().has_value());
    EXPECT_EQ(entriesIn(deathRow()), 0u);
}

TEST_F(DeathRowTest, SystemContainersGetNewDirectoriesExceptWellKnownAndAnalytics) {
    auto user = QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity();
    auto& cache = QRNContainerCache::sharedInstance();
    auto cached = [&](const QRNMetadataPtr& metadata) {
        auto found = cache.containerForContainerIdentity(metadata->containerIdentity());
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
        const std::uint64_t cls = identifier.starts_with("systemgroup.")
                                      ? kQRNContainerClassSystemGroup
                                      : kQRNContainerClassSystemData;
        auto identity =
            QRNContainerIdentity::containerIdentityWithUserIdentity(user, identifier, cls);
        auto made =
            connection().createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
        ASSERT_TRUE(made.has_value()) << identifier << ": code " << made.error();
        before[identifier] = *made;
    }
    connection()._regenerateAllSystemContainerPaths();

    for (const auto& [identifier, old] : before) {
        QRNMetadataPtr now = cached(old);
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
    EXPECT_EQ(mapped, cached(before["com.example.systemd"])->url().string());
    // A cache rebuilt from disk finds every container where it now is.
    cache.invalidateUserIdentity(user);
    for (const auto& [identifier, old] : before) {
        EXPECT_TRUE(cached(old)) << identifier;
    }
}

} // namespace
