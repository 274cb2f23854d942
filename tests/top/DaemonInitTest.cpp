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
#include <vector>

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
    // Lines in a notification file; -1 when there is none.
    long notifications(std::string_view name) {
        std::ifstream in(root_.context().instance<Paths>().runDirectory() / "notifications" /
                         std::string(name));
        return in ? std::count(std::istreambuf_iterator<char>(in), {}, '\n') : -1;
    }

    FirstBootMarker marker_;
};

TEST_F(DaemonInitTest,
       FirstStartRunsTheFirstBootPassesFirstAndTheNextOnlyTheBootPassesOnALockedDevice) {
    // The first start leaves the marker the second one finds.
    for (bool firstBoot : {true, false}) {
        SCOPED_TRACE(firstBoot ? "first start" : "second start");
        const fs::path transient = QRNGlobalConfiguration::sharedInstance().transientDirectory();
        fs::create_directories(transient);
        test::LogCapture log;
        if (!firstBoot) {
            root_.writeFile("/private/var/run/quarnd/lockstate", "1\n");
        }
        {
            QRNDaemon daemon(root_.sharedContext());
            initialise(daemon);
            // A device locked at start suspends the lock-state queue.
            EXPECT_EQ(daemon.lockStateFollower()->recordedState() == LockState::kLocked,
                      !firstBoot);
        }
        // Index of the first message beginning with `prefix` (signposts begin
        // with their name), or -1.
        const auto messages = log.messages();
        auto indexOf = [&](std::string_view prefix) {
            auto found = std::find_if(messages.begin(), messages.end(),
                                      [&](const std::string& m) { return m.starts_with(prefix); });
            return found == messages.end() ? -1L : static_cast<long>(found - messages.begin());
        };
        const long setup = indexOf("BootSetup ["), cleanup = indexOf("BootCleanup [");
        EXPECT_GE(setup, 0);
        EXPECT_GE(cleanup, 0);
        EXPECT_EQ(notifications(Notifications::kCleanupComplete), firstBoot ? 1 : 2);
        EXPECT_TRUE(marker_.exists());
        if (firstBoot) {
            const std::vector<long> order = {indexOf("FirstBootSetup ["), setup,
                                             indexOf("FirstBootCleanup ["), cleanup};
            EXPECT_TRUE(order[0] >= 0 && std::is_sorted(order.begin(), order.end()))
                << ::testing::PrintToString(order);
            EXPECT_EQ(notifications(Notifications::kRebootCleanupComplete), 1);
            EXPECT_FALSE(fs::exists(transient)) << "first-boot cleanup did not run";
            EXPECT_TRUE(
                fs::exists(QRNGlobalConfiguration::sharedInstance().logDirectory() / "quarnd.log"));
        } else {
            EXPECT_FALSE(log.contains("first boot") || log.contains("FirstBoot")) << log.all();
            // Still the one line of the first start.
            EXPECT_EQ(notifications(Notifications::kRebootCleanupComplete), 1);
            EXPECT_TRUE(fs::exists(transient)) << "transient data is kept until a first boot";
        }
    }
}

} // namespace
