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

// Each test has a daemon of its own, as each needs its own start.
class Startup : public ::testing::Test {
protected:
    void TearDown() override {
        if (harness_.isRunning()) {
            harness_.expectCleanStop();
        }
        if (HasFailure()) {
            std::cerr << "---- quarnd stderr ----\n" << harness_.log() << "----\n";
        }
    }
    // Lines of "<run>/notifications/<name>": one per posting.
    std::size_t postings(const char* name) const {
        std::ifstream in(Paths(harness_.root()).runDirectory() / "notifications" / name);
        return static_cast<std::size_t>(std::count(std::istreambuf_iterator<char>(in), {}, '\n'));
    }

    DaemonHarness harness_;
};

// The datagram socket a service manager would listen on for READY=1.
class NotifySocket {
public:
    explicit NotifySocket(const std::filesystem::path& path)
        : path_(path), fd_(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
        EXPECT_EQ(::bind(fd_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address),
                  0);
    }
    std::string environment() const { return "NOTIFY_SOCKET=" + path_.string(); }
    // Whether READY=1 is among the messages received so far.
    bool readyReceived() {
        char message[4096];
        for (ssize_t n; (n = ::recv(fd_.get(), message, sizeof message, 0)) > 0;) {
            ready_ |= std::string_view(message, static_cast<std::size_t>(n)).find("READY=1") !=
                      std::string_view::npos;
        }
        return ready_;
    }

private:
    std::filesystem::path path_;
    Descriptor fd_;
    bool ready_ = false;
};

} // namespace

// Started again in the same boot, the daemon finds the marker, so only the
// boot work runs, and it finds the container made before.
TEST_F(Startup, FirstBootWorkRunsOnlyWhileTheMarkerIsAbsentAndARestartFindsWhatWasMade) {
    const FirstBootMarker marker(harness_.root());
    ASSERT_FALSE(marker.exists());
    ASSERT_TRUE(harness_.start());
    ASSERT_TRUE(waitUntil(
        [&] { return postings(kRebootCleanupComplete) == 1 && postings(kCleanupComplete) == 1; }));
    EXPECT_TRUE(marker.exists());
    EXPECT_NE(harness_.log().find("quarnd performing first boot initialization"),
              std::string::npos);
    const auto lookup = [&](bool create) {
        return harness_.request(
            QRNClientRequests::createOrLookup("com.orvex.test.kept", 2, create, false));
    };
    const Value created = lookup(true);
    ASSERT_EQ(replyError(created), kQRNErrorNone) << created.description();
    harness_.expectCleanStop();

    ASSERT_TRUE(harness_.start());
    ASSERT_TRUE(waitUntil([&] { return postings(kCleanupComplete) == 2; }));
    EXPECT_EQ(postings(kRebootCleanupComplete), 1u);
    EXPECT_EQ(harness_.log().find("first boot"), std::string::npos);
    const Value found = lookup(false);
    EXPECT_EQ(replyError(found), kQRNErrorNone) << found.description();
    EXPECT_TRUE(found.get("ReplyUUID") && *found.get("ReplyUUID") == *created.get("ReplyUUID"));
}

TEST_F(Startup, ClientConnectingDuringInitialisationIsServedAfterIt) {
    NotifySocket notify(harness_.root() / "notify.sock");
    ASSERT_TRUE(harness_.start({notify.environment()}));
    auto client = harness_.connect();
    ASSERT_TRUE(client) << client.error().description();
    if (notify.readyReceived()) {
        std::cout << "note: initialisation ended before the client connected\n";
    }
    auto reply =
        client->send(QRNClientRequests::createOrLookup("com.orvex.test.early", 2, true, false));
    ASSERT_TRUE(reply) << reply.error().description();
    EXPECT_EQ(replyError(*reply), kQRNErrorNone) << reply->description();
    // Readiness is announced at the end of initialisation, and the request
    // was served after it.
    EXPECT_TRUE(notify.readyReceived());
}

} // namespace quarn::test
