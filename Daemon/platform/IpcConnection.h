#pragma once
// One client connection of the request service. The daemon sets an event
// handler and resumes the connection; from then on the handler hears each
// message, one at a time and in arrival order (the next message is read
// only after the handler has returned), and once the end of the connection.
//
// Abstract so that the request layer can be tested without sockets.

#include "Daemon/platform/IpcPeer.h"
#include "Daemon/support/Value.h"

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>

namespace quarn {

class IpcConnection {
public:
    // The process that wrote a message's bytes, as the kernel stamped them
    // on the socket. A pid of 0 is a writer that cannot be named (another
    // pid namespace, or bytes that came without credentials).
    struct Sender {
        pid_t pid = 0;
        uid_t uid = 0;
        gid_t gid = 0;
        bool operator==(const Sender&) const = default;
    };
    struct Event {
        enum class Kind {
            Message,     // a request dictionary
            Invalidated, // the connection has ended (peer gone, bad frame, cancel)
        };
        Kind kind = Kind::Message;
        Value body;                // the message, for Kind::Message
        bool expectsReply = false; // the frame's reply flag
    };
    using EventHandler =
        std::function<void(const std::shared_ptr<IpcConnection>& connection, const Event& event)>;

    virtual ~IpcConnection() = default;

    virtual const IpcPeer& peer() const = 0;
    // The writer of the message whose handler is running, for that handler
    // only; none when the transport cannot tell, and then the connection's
    // peer is taken as the writer.
    virtual std::optional<Sender> messageSender() const { return std::nullopt; }
    // Whether the peer's process still runs the program it ran when it
    // connected (and is alive); asked again after anything was read about
    // it from /proc, which an execve in between would have changed.
    virtual bool runsSameProgram() const { return true; }

    // Both before resume(); a connection never resumed reads nothing.
    // resume() greets the client, which writes nothing before that.
    virtual void setEventHandler(EventHandler handler) = 0;
    virtual void resume() = 0;

    // Sends one reply frame. Safe from any thread, also after the handler
    // returned (asynchronous replies); dropped once the connection ended.
    // A reply over the frame limit is logged and replaced by a small one
    // whose "ReplyError" is kQRNErrorException.
    virtual void sendReply(const Value& reply) = 0;
    // Ends the connection; pending replies are dropped.
    virtual void cancel() = 0;
};

} // namespace quarn
