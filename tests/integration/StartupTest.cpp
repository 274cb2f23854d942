// Start-up of the daemon: first-boot work once per boot (the marker), boot
// work at every start, and clients that connect before initialisation ends.

#include "Client/QRNClientRequests.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "DaemonHarness.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <algorithm>
#include <cstring>
#include <fstream>
#include <iterator>

namespace quarn::test {

namespace {

constexpr const char* kCleanupComplete = "com.orvex.quarnd.cleanup-complete";
constexpr const char* kRebootCleanupComplete = "com.orvex.quarnd.reboot-cleanup-complete";

} // namespace

// Started again in the same boot, the daemon finds the marker, so only the
// boot work runs, and it finds the container made before. The first request
// comes as soon as the socket accepts, during initialisation: it is served
// after it, once readiness has been announced.
TEST(Startup,
     FirstBootWorkRunsOnceEarlyClientsAreServedAfterInitialisationAndARestartFindsWhatWasMade) {
    DaemonHarness harness;
    const Descriptor notify(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    const std::string notifyPath = (harness.root() / "notify.sock").string();
    std::strncpy(address.sun_path, notifyPath.c_str(), sizeof address.sun_path - 1);
    ASSERT_EQ(::bind(notify.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    // Lines of "<run>/notifications/<name>": one per posting.
    const auto postings = [&](const char* name) {
        std::ifstream in(Paths(harness.root()).runDirectory() / "notifications" / name);
        return static_cast<std::size_t>(std::count(std::istreambuf_iterator<char>(in), {}, '\n'));
    };
    const auto lookup = [&](bool create) {
        return harness.request(
            QRNClientRequests::createOrLookup("com.orvex.test.kept", 2, create, false));
    };
    const FirstBootMarker marker(harness.root());
    ASSERT_FALSE(marker.exists());
    ASSERT_TRUE(harness.start({"NOTIFY_SOCKET=" + notifyPath}));
    const Value created = lookup(true);
    ASSERT_EQ(replyError(created), kQRNErrorNone) << created.description();
    std::string heard;
    char message[512];
    for (ssize_t n; (n = ::recv(notify.get(), message, sizeof message, 0)) > 0;) {
        heard.append(message, static_cast<std::size_t>(n));
    }
    EXPECT_NE(heard.find("READY=1"), std::string::npos);
    ASSERT_TRUE(waitUntil(
        [&] { return postings(kRebootCleanupComplete) == 1 && postings(kCleanupComplete) == 1; }));
    EXPECT_TRUE(marker.exists());
    harness.expectCleanStop();

    ASSERT_TRUE(harness.start());
    ASSERT_TRUE(waitUntil([&] { return postings(kCleanupComplete) == 2; }));
    EXPECT_EQ(postings(kRebootCleanupComplete), 1u);
    const Value found = lookup(false);
    EXPECT_EQ(replyError(found), kQRNErrorNone) << found.description();
    EXPECT_TRUE(found.get("ReplyUUID") && *found.get("ReplyUUID") == *created.get("ReplyUUID"));
}

} // namespace quarn::test
