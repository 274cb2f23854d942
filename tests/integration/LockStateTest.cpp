// The device lock state, which the daemon follows from "<run>/lockstate",
// changes under a running daemon; requests are served in every state.

#include "Client/QRNClientRequests.h"
#include "ServingTest.h"

#include <fstream>

namespace quarn::test {

TEST_F(Serving, LockStateChangesDoNotDisturbServing) {
    const std::filesystem::path file = daemon().runDirectory() / "lockstate";
    const std::size_t logStart = daemon().logSize();
    std::size_t seen = 0; // where the previous report was found in the log
    // Locked, transitional, unlocked, locked again, and the file removed
    // (which reads as unlocked).
    for (const char* state : {"1", "2", "0", "1", ""}) {
        SCOPED_TRACE(*state ? state : "removed");
        if (*state) {
            std::ofstream(file, std::ios::trunc) << state << "\n";
        } else {
            std::filesystem::remove(file);
        }
        const std::string report = std::string("LockState=") + (*state ? state : "0");
        ASSERT_TRUE(waitUntil([&] {
            const std::size_t at = daemon().log(logStart).find(report, seen);
            if (at == std::string::npos) {
                return false;
            }
            seen = at + report.size();
            return true;
        })) << "the daemon did not report "
            << report;
        const Value reply = daemon().request(
            QRNClientRequests::createOrLookup("com.orvex.test.lockstate", 2, true, false));
        EXPECT_EQ(replyError(reply), kQRNErrorNone) << reply.description();
    }
}

} // namespace quarn::test
