#pragma once
// What the listener and its connections share, kept alive by whichever of
// them goes last: one io_context per worker thread, a gate that refuses new
// work once the pool is stopping, and the set of open connections.
//
// Each context is run by exactly one thread and each connection is pinned
// to one context, so everything a connection does on its context runs on
// one thread without a strand, and a request is handled on the thread that
// saw its bytes arrive: no hand-over between threads, which on a machine
// with few cores cost more than the request itself. The price is that a
// slow request delays the other connections pinned to the same thread. The
// acceptor has a context of its own (index 0) that no connection is pinned
// to, so a slow request never holds up accepting new connections.
//
// The connection slots are shared out by uid (IpcConnectionSlots); when
// they run short, idle connections are closed, the uid holding most first.
//
// The gate matters because work posted after the pool has gone would never
// run, and the connection it holds would never be released.

#include "Daemon/platform/IpcConnectionSlots.h"

#include <asio/io_context.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <utility>
#include <vector>

namespace quarn {

class AsioIpcConnection;

class IpcServiceCore {
public:
    // At least one context for connections, and the acceptor's.
    IpcServiceCore(std::size_t contexts, IpcConnectionSlots::Quota quota,
                   std::chrono::milliseconds memoryTrimInterval);

    std::size_t contextCount() const { return contexts_.size(); }
    asio::io_context& io(std::size_t index) { return *contexts_[index]; }
    // The acceptor's context.
    static constexpr std::size_t kAcceptorContext = 0;
    // The context for the next connection, round robin over all but the
    // acceptor's.
    asio::io_context& nextContext();
    // Whether the calling thread is running one of the contexts.
    bool runningOnPool() const;

    // Posts `work` to `executor` unless the gate is closed; false then.
    template <class Executor, class Work> bool post(const Executor& executor, Work&& work) {
        std::lock_guard lock(gateMutex_);
        if (gateClosed_) {
            return false;
        }
        asio::post(executor, std::forward<Work>(work));
        return true;
    }
    void closeGate();

    // Whether a connection of `uid` would get a slot now.
    bool hasSlotFor(uid_t uid) const;
    // Both answer the number of connections open afterwards; `add` adds
    // nothing and answers 0 when the connection's uid gets no slot.
    std::size_t add(const std::shared_ptr<AsioIpcConnection>& connection);
    std::size_t remove(const AsioIpcConnection* connection);
    std::vector<std::shared_ptr<AsioIpcConnection>> connections() const;
    std::size_t openCount() const;
    // Idle connections idle since before `cutoff`, enough to bring the open
    // count down to `keep` if that many are idle, those of the uid holding
    // most slots first.
    std::vector<std::shared_ptr<AsioIpcConnection>>
    idleConnections(std::chrono::steady_clock::time_point cutoff, std::size_t keep) const;

    // Gives freed heap back to the system, at most once per trim interval:
    // a call within the interval of the last trim has one made at its end,
    // so memory freed by a burst of large frames does not stay with the daemon.
    void trimMemory();

private:
    std::vector<std::unique_ptr<asio::io_context>> contexts_;
    std::atomic<std::size_t> nextContext_{0};
    // Guards gateClosed_; held while posting so that closing cannot slip in
    // between the check and the post.
    std::mutex gateMutex_;
    bool gateClosed_ = false;
    mutable std::mutex connectionsMutex_; // guards connections_ and slots_
    struct Entry {
        std::weak_ptr<AsioIpcConnection> connection;
        uid_t uid = 0;
    };
    std::unordered_map<const AsioIpcConnection*, Entry> connections_;
    IpcConnectionSlots slots_;
    const std::chrono::milliseconds memoryTrimInterval_;
    std::atomic<std::chrono::steady_clock::rep> lastTrim_{0};
    // Guards trimTimer_ and trimPending_: any pool thread may ask for a trim.
    std::mutex trimMutex_;
    std::unique_ptr<asio::steady_timer> trimTimer_; // on the acceptor's context
    bool trimPending_ = false;
    void trimNow();
};

} // namespace quarn
