// Many clients at once: each identity gets exactly one container, however
// its creations and lookups interleave.

#include "Client/QRNClientRequests.h"
#include "ServingTest.h"

#include <fmt/format.h>

#include <algorithm>
#include <latch>
#include <map>
#include <set>
#include <thread>

namespace quarn::test {

namespace {

constexpr std::size_t kClients = 16;
constexpr std::size_t kShared = 4;
constexpr std::size_t kDistinctPerClient = 12;
constexpr std::size_t kRounds = 3;
// Used by no other test of this daemon, so its directory holds only ours.
constexpr std::uint64_t kClass = 10;

struct Answer {
    std::string identifier;
    std::optional<UUID> uuid;
    bool existed = false;
    std::uint64_t error = 0;
};

// Each client asks for the shared identifiers and its own, starting at a
// different place of the list so that the clients collide on every one.
std::vector<std::string> identifiersOf(std::size_t client) {
    std::vector<std::string> identifiers;
    for (std::size_t i = 0; i < kShared; ++i) {
        identifiers.push_back("com.orvex.test.shared." + std::to_string(i));
    }
    for (std::size_t i = 0; i < kDistinctPerClient; ++i) {
        identifiers.push_back(fmt::format("com.orvex.test.client{}.{}", client, i));
    }
    std::rotate(identifiers.begin(), identifiers.begin() + client % identifiers.size(),
                identifiers.end());
    return identifiers;
}

std::vector<Answer> runClient(const DaemonHarness& harness, std::size_t client, std::latch& start) {
    std::vector<Answer> answers;
    auto connection = harness.connect();
    start.arrive_and_wait();
    for (std::size_t round = 0; connection && round < kRounds; ++round) {
        for (const std::string& identifier : identifiersOf(client)) {
            auto reply = connection->send(
                QRNClientRequests::createOrLookup(identifier, kClass, true, false));
            Answer answer;
            answer.identifier = identifier;
            if (reply) {
                answer.error = replyError(*reply);
                const Value* uuid = reply->get("ReplyUUID");
                const Value* existed = reply->get("ReplyExisted");
                answer.uuid = uuid ? uuid->asUUID() : std::nullopt;
                answer.existed = existed && existed->asBool().value_or(false);
            }
            answers.push_back(answer);
        }
    }
    return answers;
}

} // namespace

TEST_F(Serving, ConcurrentClientsGetOneContainerPerIdentity) {
    std::vector<std::vector<Answer>> answers(kClients);
    std::latch start(kClients);
    {
        std::vector<std::jthread> clients;
        for (std::size_t i = 0; i < kClients; ++i) {
            clients.emplace_back([&, i] { answers[i] = runClient(daemon(), i, start); });
        }
    }
    std::map<std::string, std::set<UUID>> uuidsOf;
    std::map<std::string, std::size_t> creationsOf;
    std::size_t replies = 0;
    for (const auto& ofClient : answers) {
        for (const Answer& answer : ofClient) {
            ++replies;
            ASSERT_EQ(answer.error, kQRNErrorNone) << answer.identifier;
            ASSERT_TRUE(answer.uuid) << answer.identifier;
            uuidsOf[answer.identifier].insert(*answer.uuid);
            creationsOf[answer.identifier] += answer.existed ? 0 : 1;
        }
    }
    EXPECT_EQ(replies, kClients * kRounds * (kShared + kDistinctPerClient));
    EXPECT_EQ(uuidsOf.size(), kShared + kClients * kDistinctPerClient);
    std::set<std::string> expectedOnDisk;
    for (const auto& [identifier, uuids] : uuidsOf) {
        EXPECT_EQ(uuids.size(), 1u) << identifier;
        EXPECT_EQ(creationsOf[identifier], 1u) << identifier;
        expectedOnDisk.insert(uuids.begin()->string());
    }
    std::set<std::string> onDisk;
    for (const auto& entry : std::filesystem::directory_iterator(
             daemon() / "/private/var/mobile/Containers/Data/InternalDaemon")) {
        onDisk.insert(entry.path().filename().string());
    }
    EXPECT_EQ(onDisk, expectedOnDisk);
}

} // namespace quarn::test
