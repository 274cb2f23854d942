// One daemon that must keep serving: under hostile frames, lock-state
// changes and many concurrent clients.

#include "Client/QRNClientRequests.h"
#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"
#include "Daemon/support/Descriptor.h"
#include "DaemonHarness.h"

#include <fmt/format.h>
#include <sys/socket.h>

#include <fstream>
#include <latch>
#include <map>
#include <set>
#include <thread>

namespace quarn::test {

namespace {

class Serving : public SharedDaemonTest {
protected:
    // Fails the calling test unless a client of the registry is served.
    static void expectServed() {
        const Value reply = daemon().request(
            QRNClientRequests::createOrLookup("com.orvex.test.served", 2, true, false));
        EXPECT_EQ(replyError(reply), kQRNErrorNone) << reply.description();
    }
};

constexpr std::uint8_t kReply = IpcFrame::kExpectsReply;

Value create(Value::Dictionary keys) {
    keys.emplace("ContainerClass", 2u);
    keys.emplace("CreateIfNecessary", true);
    keys.emplace("Command", 0u);
    return Value(std::move(keys));
}

// A request whose "Deep" key holds arrays nested so that, with the
// request's own map, `depth` containers sit inside each other.
Value nested(std::size_t depth) {
    Value deep = Value::array();
    for (std::size_t level = 2; level < depth; ++level) {
        deep = Value(Value::Array{deep});
    }
    return create({{"Identifier", "com.orvex.test.nested"}, {"Deep", deep}});
}

// A request padded to exactly `size` bytes of CBOR.
Value padded(std::size_t size) {
    Value request = create({{"Identifier", "com.orvex.test.padded"}, {"Pad", Value::Data()}});
    const std::size_t bare = CborCodec::encode(request).size();
    // A byte string this long has a length field of a fixed size.
    request.set("Pad", Value::Data(size - bare - 4));
    EXPECT_EQ(CborCodec::encode(request).size(), size);
    return request;
}

} // namespace

// Frames no well-behaved client sends, over a raw socket: each may end its
// own connection, never the daemon.
TEST_F(Serving, HostileFramesEndOnlyTheirOwnConnection) {
    enum After { kWait, kHangUp, kShutdownWrite };
    const Value normal = create({{"Identifier", "com.orvex.test.hostile"}});
    const std::vector<std::uint8_t> body = CborCodec::encode(normal);
    const auto size = static_cast<std::uint32_t>(body.size());
    const auto frame = [](const Value& v) { return FrameSocket::frame(v, kReply); };
    const auto raw = [](std::uint32_t length, std::uint8_t flags, std::vector<std::uint8_t> b) {
        return FrameSocket::rawFrame(length, flags, b);
    };
    std::vector<std::uint8_t> twoRequests = frame(normal);
    const auto second = frame(create({{"ContainerClass", 0u}}));
    twoRequests.insert(twoRequests.end(), second.begin(), second.end());
    const Value unknownKeys = create(
        {{"Identifier", "com.orvex.test.unknown"}, {"NoSuchKey", Value(Value::Dictionary{})}});
    const struct {
        std::string name;
        std::vector<std::uint8_t> bytes;
        After after;
        std::vector<std::uint64_t> replies; // the expected codes, in order; none: closed
    } cases[] = {
        {"truncated header", {0x10, 0x00, 0x00}, kShutdownWrite, {}},
        {"truncated body, gone", raw(100, kReply, {0xa1, 0x67}), kHangUp, {}},
        {"over 1 MiB", raw((1u << 20) + 1, kReply, {}), kWait, {}},
        {"reserved flag bits", raw(size, 0x03, body), kWait, {}},
        {"not CBOR", raw(3, kReply, {0xff, 0xfe, 0x13}), kWait, {}},
        {"not a map", frame(Value(Value::Array{0u})), kWait, {}},
        {"nesting 33 deep", frame(nested(33)), kWait, {}},
        {"reply flag clear", FrameSocket::frame(normal, 0), kWait, {}},
        {"exactly 1 MiB", frame(padded(1u << 20)), kWait, {kQRNErrorNone}},
        {"nesting 32 deep", frame(nested(32)), kWait, {kQRNErrorNone}},
        {"unknown keys", frame(unknownKeys), kWait, {kQRNErrorNone}},
        {"two requests in one write",
         twoRequests,
         kWait,
         {kQRNErrorNone, kQRNErrorUnexpectedContainerType}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        Descriptor connection(FrameSocket::connectGreeted(daemon().socketPath()));
        // Every read ends by the limit: a silent daemon fails the test, not hangs it.
        const timeval limit{.tv_sec = kWaitLimit.count(), .tv_usec = 0};
        ASSERT_EQ(::setsockopt(connection.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit), 0);
        ASSERT_TRUE(FrameSocket::writeAll(connection.get(), c.bytes));
        if (c.after == kHangUp) {
            connection.close();
        } else if (c.after == kShutdownWrite) {
            ::shutdown(connection.get(), SHUT_WR);
        }
        for (std::uint64_t expected : c.replies) {
            std::vector<std::uint8_t> replyBody;
            const auto reply = FrameSocket::readFrame(connection.get(), replyBody);
            ASSERT_TRUE(reply && reply->message) << "no reply";
            EXPECT_EQ(replyError(*reply->message), expected) << reply->message->description();
        }
        // Refused frames end their connection; a hang-up has none left.
        if (c.replies.empty() && c.after != kHangUp) {
            std::uint8_t byte = 0;
            const ssize_t n = ::recv(connection.get(), &byte, 1, 0);
            EXPECT_TRUE(n == 0 || (n < 0 && errno == ECONNRESET)) << "still open";
        }
        // Whatever that connection did, the next client is served.
        expectServed();
    }
}

// The lock state the daemon follows from "<run>/lockstate" changes under it
// (a removed file reads as unlocked); requests are served in each state.
TEST_F(Serving, LockStateChangesDoNotDisturbServing) {
    const std::filesystem::path file = Paths(daemon().root()).runDirectory() / "lockstate";
    std::size_t seen = daemon().logSize(); // where the previous report ended in the log
    for (const char* state : {"1", "2", "0", "1", ""}) {
        SCOPED_TRACE(*state ? state : "removed");
        *state ? void(std::ofstream(file) << state << "\n") : void(std::filesystem::remove(file));
        const std::string report = std::string("LockState=") + (*state ? state : "0");
        ASSERT_TRUE(waitUntil([&] { return daemon().log(seen).find(report) != std::string::npos; }))
            << report;
        seen += daemon().log(seen).find(report) + report.size();
        expectServed();
    }
}

// Many clients at once, colliding on shared identifiers: each identity gets
// exactly one container, however its creations and lookups interleave.
TEST_F(Serving, ConcurrentClientsGetOneContainerPerIdentity) {
    constexpr std::size_t kClients = 16, kShared = 4, kOwn = 12, kRounds = 3;
    // Used by no other test of this daemon, so its directory holds only ours.
    constexpr std::uint64_t kClass = 10;
    constexpr std::size_t kIdentifiers = kShared + kOwn;
    std::vector<std::vector<std::pair<std::string, Value>>> replies(kClients);
    std::latch start(kClients);
    {
        std::vector<std::jthread> clients;
        for (std::size_t client = 0; client < kClients; ++client) {
            clients.emplace_back([&, client] {
                auto connection = daemon().connect();
                start.arrive_and_wait();
                // Each starts at another place of the list, to collide on every one.
                for (std::size_t n = 0; connection && n < kRounds * kIdentifiers; ++n) {
                    const std::size_t i = (n + client) % kIdentifiers;
                    const std::string identifier =
                        i < kShared ? fmt::format("com.orvex.test.shared.{}", i)
                                    : fmt::format("com.orvex.test.client{}.{}", client, i);
                    auto reply = connection->send(
                        QRNClientRequests::createOrLookup(identifier, kClass, true, false));
                    replies[client].emplace_back(identifier, reply ? *reply : Value());
                }
            });
        }
    }
    std::map<std::string, std::set<UUID>> uuidsOf;
    std::map<std::string, std::size_t> creationsOf;
    std::size_t count = 0;
    for (const auto& ofClient : replies) {
        for (const auto& [identifier, reply] : ofClient) {
            ++count;
            ASSERT_EQ(replyError(reply), kQRNErrorNone) << identifier;
            const Value* uuid = reply.get("ReplyUUID");
            ASSERT_TRUE(uuid && uuid->asUUID()) << identifier;
            uuidsOf[identifier].insert(*uuid->asUUID());
            const Value* existed = reply.get("ReplyExisted");
            creationsOf[identifier] += existed && existed->asBool().value_or(false) ? 0 : 1;
        }
    }
    EXPECT_EQ(count, kClients * kRounds * kIdentifiers);
    EXPECT_EQ(uuidsOf.size(), kShared + kClients * kOwn);
    std::set<std::string> expectedOnDisk, onDisk;
    for (const auto& [identifier, uuids] : uuidsOf) {
        EXPECT_EQ(uuids.size(), 1u) << identifier;
        EXPECT_EQ(creationsOf[identifier], 1u) << identifier;
        expectedOnDisk.insert(uuids.begin()->string());
    }
    for (const auto& entry : std::filesystem::directory_iterator(
             daemon() / "/private/var/mobile/Containers/Data/InternalDaemon")) {
        onDisk.insert(entry.path().filename().string());
    }
    EXPECT_EQ(onDisk, expectedOnDisk);
}

} // namespace quarn::test
