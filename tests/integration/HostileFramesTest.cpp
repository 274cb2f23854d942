// Frames no well-behaved client sends, from the test binary over a raw
// socket: each may end its own connection, never the daemon.

#include "Client/QRNClientRequests.h"
#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"
#include "RawConnection.h"
#include "ServingTest.h"
#include "common/shared/FrameSocket.h"

namespace quarn::test {

namespace {

constexpr std::uint8_t kReply = IpcFrame::kExpectsReply;

struct Case {
    std::string name;
    std::vector<std::uint8_t> bytes;
    // Then: hang up at once, or half-close so the daemon sees the end.
    enum class After { Wait, HangUp, ShutdownWrite } after = After::Wait;
    std::vector<std::uint64_t> replies; // the expected codes, in order
    bool closedByDaemon = false;
    std::string logReason; // in the daemon's log when it closes
};

std::vector<std::uint8_t> concat(std::vector<std::uint8_t> a, const std::vector<std::uint8_t>& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

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
    Value request = create({{"Identifier", "com.orvex.test.padded"}});
    request.set("Pad", Value::Data());
    const std::size_t bare = CborCodec::encode(request).size();
    // A byte string this long has a length field of a fixed size.
    request.set("Pad", Value::Data(size - bare - 4));
    EXPECT_EQ(CborCodec::encode(request).size(), size);
    return request;
}

std::vector<Case> cases() {
    const Value normal = create({{"Identifier", "com.orvex.test.hostile"}});
    const std::vector<std::uint8_t> normalBody = CborCodec::encode(normal);
    const auto raw = [](std::uint32_t length, std::uint8_t flags, std::vector<std::uint8_t> body) {
        return FrameSocket::rawFrame(length, flags, body);
    };
    using A = Case::After;
    // The daemon ends the connection, and says why in its log.
    const auto closes = [](std::string name, std::vector<std::uint8_t> bytes, A after,
                           std::string reason) {
        return Case{std::move(name), std::move(bytes), after, {}, true, std::move(reason)};
    };
    const auto answers = [](std::string name, std::vector<std::uint8_t> bytes,
                            std::vector<std::uint64_t> codes) {
        return Case{std::move(name), std::move(bytes), A::Wait, std::move(codes), false, ""};
    };
    return {
        closes("truncated header", {0x10, 0x00, 0x00}, A::ShutdownWrite, ""),
        Case{"truncated body, then gone", raw(100, kReply, {0xa1, 0x67}), A::HangUp, {}, false, ""},
        closes("frame over 1 MiB", raw((1u << 20) + 1, kReply, {}), A::Wait, "over the limit"),
        closes("reserved flag bits",
               raw(static_cast<std::uint32_t>(normalBody.size()), 0x03, normalBody), A::Wait,
               "reserved bits"),
        closes("not CBOR", raw(3, kReply, {0xff, 0xfe, 0x13}), A::Wait, "does not decode"),
        closes("CBOR that is no map", FrameSocket::frame(Value(Value::Array{0u}), kReply), A::Wait,
               "not a dictionary"),
        closes("nesting 33 deep", FrameSocket::frame(nested(33), kReply), A::Wait,
               "nest deeper than 32"),
        closes("reply flag clear", FrameSocket::frame(normal, 0x00), A::Wait,
               "Dictionary does not have reply context"),
        answers("frame of exactly 1 MiB", FrameSocket::frame(padded(1u << 20), kReply),
                {kQRNErrorNone}),
        answers("nesting 32 deep", FrameSocket::frame(nested(32), kReply), {kQRNErrorNone}),
        answers("unknown keys",
                FrameSocket::frame(create({{"Identifier", "com.orvex.test.unknown"},
                                           {"NoSuchKey", Value(Value::Dictionary{{"a", 1u}})}}),
                                   kReply),
                {kQRNErrorNone}),
        answers("two requests in one write",
                concat(FrameSocket::frame(normal, kReply),
                       FrameSocket::frame(create({{"ContainerClass", 0u}}), kReply)),
                {kQRNErrorNone, kQRNErrorUnexpectedContainerType}),
    };
}

} // namespace

TEST_F(Serving, HostileFramesEndOnlyTheirOwnConnection) {
    for (const Case& c : cases()) {
        SCOPED_TRACE(c.name);
        const std::size_t logStart = daemon().logSize();
        RawConnection connection(daemon().socketPath());
        ASSERT_TRUE(connection.write(c.bytes));
        if (c.after == Case::After::HangUp) {
            connection.close();
        } else if (c.after == Case::After::ShutdownWrite) {
            connection.shutdownWrite();
        }
        for (std::uint64_t expected : c.replies) {
            const std::optional<Value> reply = connection.readReply();
            ASSERT_TRUE(reply) << "no reply";
            EXPECT_EQ(replyError(*reply), expected) << reply->description();
        }
        if (c.closedByDaemon) {
            EXPECT_TRUE(connection.waitForClose());
        }
        EXPECT_NE(daemon().log(logStart).find(c.logReason), std::string::npos);
        connection.close();
        // Whatever that connection did, the next client is served.
        const Value reply = daemon().request(
            QRNClientRequests::createOrLookup("com.orvex.test.after", 2, true, false));
        ASSERT_EQ(replyError(reply), kQRNErrorNone) << reply.description();
        ASSERT_TRUE(daemon().isRunning());
    }
}

} // namespace quarn::test
