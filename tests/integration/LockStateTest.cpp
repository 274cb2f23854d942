// The device lock state, which the daemon follows from "<run>/lockstate",
// changes under a running daemon; requests are served in every state.

#include "Client/QRNClientRequests.h"
#include "ServingTest.h"

#include <fstream>

namespace quarn::test {

TEST_F(Serving, LockStateChangesDoNotDisturbServing) {
    const std::filesystem::path file = daemon().runDirectory() / "lockstate";
    std::size_t seen = daemon().logSize(); // where the previous report ended in the log
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
        const std::size_t at = daemon().waitForLog(report, seen);
        ASSERT_NE(at, std::string::npos) << "the daemon did not report " << report;
        seen = at + report.size();
        const Value reply = daemon().request(
            QRNClientRequests::createOrLookup("com.orvex.test.lockstate", 2, true, false));
        EXPECT_EQ(replyError(reply), kQRNErrorNone) << reply.description();
    }
}

} // namespace quarn::test
