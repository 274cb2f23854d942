// A registered program's entitlements are the rights of that program run by
// the users its entry names: anyone else running it, or running it with
// code of their own preloaded, gets the identifier without the rights.

#include "Attacker.h"
#include "Client/QRNClientRequests.h"
#include "DaemonHarness.h"

#include <sys/stat.h>

#include <fstream>

namespace quarn::test {

namespace {

class EntitlementAttack : public SharedDaemonTest {
protected:
    // The replies the registered client `program` gets for `requests`, run
    // through setpriv as `uid` (root: directly) with `environment` added.
    static std::vector<Value> repliesAs(uid_t uid, std::string_view program,
                                        std::vector<std::string> environment,
                                        const std::vector<Value>& requests) {
        const auto client = daemon().root() / "clients" / program;
        const auto out = daemon().root() / ("as-" + std::to_string(++runs_));
        std::vector<std::string> arguments;
        if (uid != 0) {
            const std::string id = std::to_string(uid);
            arguments = {"--reuid=" + id, "--regid=" + id, "--clear-groups", client.string()};
        }
        arguments.insert(arguments.end(), {"--socket", daemon().socketPath().string()});
        for (const Value& request : requests) {
            arguments.push_back(HexCbor::encode(request));
        }
        auto child = ChildProcess::spawn(
            {uid != 0 ? "/usr/bin/setpriv" : client, arguments, std::move(environment), out, {}});
        EXPECT_TRUE(child && child->waitFor(kWaitLimit));
        std::vector<Value> replies;
        std::ifstream in(out);
        for (std::string line; std::getline(in, line);) {
            replies.push_back(HexCbor::decode(line).value_or(Value()));
        }
        return replies;
    }
    static inline int runs_ = 0;
};

TEST_F(EntitlementAttack, OthersRunningAnEntitledProgramGetNoRights) {
    // Others must reach the socket and the client programs.
    ASSERT_EQ(::chmod(daemon().root().c_str(), 0755), 0);
    const Value made = daemon().request(
        QRNClientRequests::createOrLookup("com.orvex.test.victim", 2, true, false));
    ASSERT_TRUE(made.get("ReplyPath")) << made.description();
    const std::string victim = *made.get("ReplyPath")->asString();

    const std::vector<Value> attempts{
        QRNClientRequests::containersOfClass(2, false),
        QRNClientRequests::deleteContainer("com.orvex.test.victim", 2, false)};
    const struct {
        const char* what;
        uid_t uid;
        std::vector<std::string> environment;
    } rows[] = {
        {"another user", kAttackerUID, {}},
        {"root with preloaded code", 0, {"LD_PRELOAD=/nonexistent/quarn-inject.so"}},
        {"root with an audit module", 0, {"LD_AUDIT=/nonexistent/quarn-audit.so"}},
    };
    for (const auto& row : rows) {
        const auto replies = repliesAs(row.uid, program::kAllowed, row.environment, attempts);
        ASSERT_EQ(replies.size(), attempts.size()) << row.what;
        for (const Value& reply : replies) {
            EXPECT_EQ(replyError(reply), kQRNErrorNotEntitled) << row.what << reply.description();
        }
        EXPECT_TRUE(std::filesystem::exists(victim)) << row.what;
    }
    // The program run by root as it is keeps its rights.
    const auto allowed = repliesAs(0, program::kAllowed, {}, {attempts[0]});
    ASSERT_EQ(allowed.size(), 1u);
    EXPECT_EQ(replyError(allowed[0]), kQRNErrorNone);
}

} // namespace

} // namespace quarn::test
