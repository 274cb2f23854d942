// Initialisation against a temporary root, with and without the first-boot
// marker: which passes run, in which order, and what they leave behind.

#include "Daemon/QRNDaemon.h"
#include "Daemon/QRNLockStateFollower.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LockState.h"
#include "Daemon/platform/Notifications.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/Queue.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <string>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

class DaemonInitTest : public test::TempRootTest {
protected:
    // The root removes its marker when it goes; one left by a run that
    // crashed on a root of the same name must not count.
    DaemonInitTest() : marker_(root_.path()) { (void)marker_.remove(); }

    // Runs initialisation the way main does and waits until the cleanups
    // it started have completed.
    void initialise(QRNDaemon& daemon) {
        daemon.submitInitialization();
        daemon.listenerQueue()->sync([&] {
            // Queued behind initialisation, as a connection would be.
            EXPECT_NE(daemon.lockStateFollower(), nullptr) << "ran before initialisation ended";
        });
        QRNClientConnection::_sharedBackgroundQueue()->sync([] {});
        QRNClientConnection::_sharedDeathrowBackgroundQueue()->sync([] {});
    }
    fs::path notificationFile(std::string_view name) {
        return root_.context().instance<Paths>().runDirectory() / "notifications" /
               std::string(name);
    }
    static std::size_t lines(const fs::path& file) {
        std::ifstream in(file);
        return std::count(std::istreambuf_iterator<char>(in), {}, '\n');
    }
    // Index of the first message beginning with `prefix`, or -1.
    static long indexOf(const test::LogCapture& log, std::string_view prefix) {
        const auto messages = log.messages();
        for (std::size_t i = 0; i < messages.size(); ++i) {
            if (messages[i].rfind(prefix, 0) == 0) {
                return static_cast<long>(i);
            }
        }
        return -1;
    }

    FirstBootMarker marker_;
};

TEST_F(DaemonInitTest, FirstBootRunsTheFirstBootPassesFirstAndLeavesTheMarker) {
    const fs::path transient = QRNGlobalConfiguration::sharedInstance().transientDirectory();
    test::LogCapture log;
    {
        QRNDaemon daemon(root_.sharedContext());
        initialise(daemon);
    }
    EXPECT_GE(indexOf(log, "quarnd performing first boot initialization"), 0);
    // Signposts begin with their name.
    const long firstSetup = indexOf(log, "FirstBootSetup [");
    const long firstCleanup = indexOf(log, "FirstBootCleanup [");
    EXPECT_GE(firstSetup, 0);
    EXPECT_LT(firstSetup, indexOf(log, "BootSetup ["));
    EXPECT_LT(indexOf(log, "BootSetup ["), firstCleanup);
    EXPECT_GE(firstCleanup, 0);
    EXPECT_LT(firstCleanup, indexOf(log, "BootCleanup ["));
    EXPECT_GE(indexOf(log, "quarnd first boot cleanup complete"), 0) << log.all();
    EXPECT_TRUE(marker_.exists());
    EXPECT_EQ(lines(notificationFile(Notifications::kRebootCleanupComplete)), 1u);
    EXPECT_EQ(lines(notificationFile(Notifications::kCleanupComplete)), 1u);
    EXPECT_FALSE(fs::exists(transient)) << "first-boot cleanup did not run";
    EXPECT_TRUE(fs::exists(QRNGlobalConfiguration::sharedInstance().logDirectory() / "quarnd.log"));
}

TEST_F(DaemonInitTest, WithTheMarkerOnlyTheBootPassesRun) {
    ASSERT_TRUE(marker_.create());
    const fs::path transient = QRNGlobalConfiguration::sharedInstance().transientDirectory();
    test::LogCapture log;
    {
        QRNDaemon daemon(root_.sharedContext());
        initialise(daemon);
    }
    EXPECT_FALSE(log.contains("first boot")) << log.all();
    EXPECT_FALSE(log.contains("FirstBoot")) << log.all();
    EXPECT_GE(indexOf(log, "BootSetup ["), 0);
    EXPECT_GE(indexOf(log, "BootCleanup ["), 0);
    EXPECT_FALSE(fs::exists(notificationFile(Notifications::kRebootCleanupComplete)));
    EXPECT_EQ(lines(notificationFile(Notifications::kCleanupComplete)), 1u);
    EXPECT_TRUE(fs::exists(transient)) << "transient data is kept until a first boot";
}

TEST_F(DaemonInitTest, ALockedDeviceAtStartSuspendsTheLockStateQueue) {
    ASSERT_TRUE(marker_.create());
    root_.writeFile("/private/var/run/quarnd/lockstate", "1\n");
    QRNDaemon daemon(root_.sharedContext());
    initialise(daemon);
    EXPECT_EQ(daemon.lockStateFollower()->recordedState(), LockState::kLocked);
}

} // namespace
