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
// slow request delays the other connections pinned to the same thread.
//
// The gate matters because work posted after the pool has gone would never
// run, and the connection it holds would never be released.

#include <asio/io_context.hpp>
#include <asio/post.hpp>

#include <atomic>
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
    // At least one context.
    explicit IpcServiceCore(std::size_t contexts);

    std::size_t contextCount() const { return contexts_.size(); }
    asio::io_context& io(std::size_t index) { return *contexts_[index]; }
    // The context for the next connection, round robin.
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

    // Both answer the number of connections open afterwards; `add` adds
    // nothing and answers 0 when `maxOpen` are open already.
    std::size_t add(const std::shared_ptr<AsioIpcConnection>& connection, std::size_t maxOpen);
    std::size_t remove(const AsioIpcConnection* connection);
    std::vector<std::shared_ptr<AsioIpcConnection>> connections() const;
    std::size_t openCount() const;

private:
    std::vector<std::unique_ptr<asio::io_context>> contexts_;
    std::atomic<std::size_t> nextContext_{0};
    // Guards gateClosed_; held while posting so that closing cannot slip in
    // between the check and the post.
    std::mutex gateMutex_;
    bool gateClosed_ = false;
    mutable std::mutex connectionsMutex_; // guards connections_
    std::unordered_map<const AsioIpcConnection*, std::weak_ptr<AsioIpcConnection>> connections_;
};

} // namespace quarn
