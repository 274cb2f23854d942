#pragma once
// A request service on a socket in a temporary root, recording which
// connections it accepted and how many messages and ends each one heard.

#include "Daemon/platform/IpcListener.h"
#include "Daemon/platform/Paths.h"

#include "common/TempRoot.h"
#include "platform/IpcTestClient.h"

#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <set>

namespace quarn::test {

// A message numbered `seq`, and the number a reply carries back (all ones
// for none).
inline Value message(std::uint64_t seq) {
    return Value(Value::Dictionary{{"Seq", Value(seq)}});
}
inline std::uint64_t seqOf(const std::optional<Value>& reply) {
    const Value* seq = reply ? reply->get("Seq") : nullptr;
    return seq && seq->asUInt64() ? *seq->asUInt64() : ~std::uint64_t{0};
}

// Fails a hung test; no test measures time.
inline constexpr auto kGuard = std::chrono::seconds(20);

class IpcListenerTest : public TempRootTest {
protected:
    using Event = IpcConnection::Event;
    using Handler = std::function<void(const std::shared_ptr<IpcConnection>&, const Event&)>;

    static void echo(const std::shared_ptr<IpcConnection>& connection, const Event& event) {
        if (event.expectsReply) {
            connection->sendReply(event.body);
        }
    }

    std::filesystem::path socketPath() const {
        return Paths(root_.path()).runDirectory() / "com.orvex.quarnd.sock";
    }
    IpcListener::Options options() const {
        IpcListener::Options o;
        o.socketPath = socketPath();
        o.workerThreads = 4;
        return o;
    }

    // Connections are resumed with `onMessage` unless their accept index is
    // in `held`. A test whose handler uses its locals stops the listener
    // before it returns: a handler may still run after the last reply.
    Status start(Handler onMessage, IpcListener::Options o, std::set<std::size_t> held = {}) {
        onMessage_ = std::move(onMessage);
        listener_ = std::make_unique<IpcListener>(std::move(o));
        return listener_->start([this, held](std::shared_ptr<IpcConnection> connection) {
            std::size_t index;
            {
                std::lock_guard lock(mutex_);
                index = accepted_.size();
                accepted_.push_back(connection);
            }
            changed_.notify_all();
            if (!held.contains(index)) {
                resume(connection);
            }
        });
    }
    Status start(Handler onMessage) { return start(std::move(onMessage), options()); }

    void resume(const std::shared_ptr<IpcConnection>& connection) {
        connection->setEventHandler([this](const auto& c, const Event& event) {
            if (event.kind == Event::Kind::Invalidated) {
                if (onEnd_) {
                    onEnd_();
                }
                std::lock_guard lock(mutex_);
                ++invalidations_[c.get()];
            } else {
                {
                    std::lock_guard lock(mutex_);
                    ++messages_[c.get()];
                }
                onMessage_(c, event);
            }
            changed_.notify_all();
        });
        connection->resume();
    }

    template <class Predicate> bool waitUntil(Predicate done) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, kGuard, done);
    }
    std::shared_ptr<IpcConnection> accepted(std::size_t index) {
        EXPECT_TRUE(waitUntil([&] { return accepted_.size() > index; }));
        std::lock_guard lock(mutex_);
        return index < accepted_.size() ? accepted_[index] : nullptr;
    }
    int invalidations(std::size_t index) { return count(invalidations_, index); }
    int messages(std::size_t index) { return count(messages_, index); }
    int count(std::map<const IpcConnection*, int>& counts, std::size_t index) {
        auto connection = accepted(index);
        std::lock_guard lock(mutex_);
        return counts[connection.get()];
    }
    void TearDown() override {
        if (listener_) {
            listener_->stop();
        }
    }

    Handler onMessage_;
    std::function<void()> onEnd_; // also hears every Invalidated
    std::mutex mutex_;            // guards the three fields below
    std::condition_variable changed_;
    std::vector<std::shared_ptr<IpcConnection>> accepted_;
    std::map<const IpcConnection*, int> invalidations_;
    std::map<const IpcConnection*, int> messages_;
    std::unique_ptr<IpcListener> listener_; // last: stopped before the rest goes
};

} // namespace quarn::test
