#pragma once
// What the listener and its connections share, kept alive by whichever of
// them goes last: the io_context the worker pool runs, a gate that refuses
// new work once the pool is stopping, and the set of open connections.
//
// The gate matters because work posted after the pool has gone would never
// run, and the connection it holds would never be released.

#include <asio/io_context.hpp>
#include <asio/post.hpp>

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
    asio::io_context& io() { return io_; }

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

    // Both answer the number of connections open afterwards.
    std::size_t add(const std::shared_ptr<AsioIpcConnection>& connection);
    std::size_t remove(const AsioIpcConnection* connection);
    std::vector<std::shared_ptr<AsioIpcConnection>> connections() const;

private:
    asio::io_context io_;
    // Guards gateClosed_; held while posting so that closing cannot slip in
    // between the check and the post.
    std::mutex gateMutex_;
    bool gateClosed_ = false;
    mutable std::mutex connectionsMutex_; // guards connections_
    std::unordered_map<const AsioIpcConnection*, std::weak_ptr<AsioIpcConnection>> connections_;
};

} // namespace quarn
