#include "Daemon/platform/IpcServiceCore.h"

#include "Daemon/platform/AsioIpcConnection.h"

#include <malloc.h>

#include <algorithm>

namespace quarn {

IpcServiceCore::IpcServiceCore(std::size_t contexts, IpcConnectionSlots::Quota quota,
                               std::chrono::milliseconds memoryTrimInterval)
    : slots_(quota), memoryTrimInterval_(memoryTrimInterval) {
    const std::size_t count = 1 + std::max<std::size_t>(1, contexts);
    contexts_.reserve(count);
    for (std::size_t i = 0; i < count; ++i) {
        // One thread runs each context.
        contexts_.push_back(std::make_unique<asio::io_context>(1));
    }
    trimTimer_ = std::make_unique<asio::steady_timer>(*contexts_[kAcceptorContext]);
}

asio::io_context& IpcServiceCore::nextContext() {
    const std::size_t turn = nextContext_.fetch_add(1, std::memory_order_relaxed);
    return *contexts_[kAcceptorContext + 1 + turn % (contexts_.size() - 1)];
}

bool IpcServiceCore::runningOnPool() const {
    return std::any_of(contexts_.begin(), contexts_.end(), [](const auto& context) {
        return context->get_executor().running_in_this_thread();
    });
}

void IpcServiceCore::closeGate() {
    {
        std::lock_guard lock(gateMutex_);
        gateClosed_ = true;
    }
    // A trim still waiting would keep the stopping pool running until it is due.
    std::lock_guard lock(trimMutex_);
    trimTimer_->cancel();
}

bool IpcServiceCore::hasSlotFor(uid_t uid) const {
    std::lock_guard lock(connectionsMutex_);
    return slots_.mayTake(uid);
}

std::size_t IpcServiceCore::add(const std::shared_ptr<AsioIpcConnection>& connection) {
    const uid_t uid = connection->peer().uid();
    std::lock_guard lock(connectionsMutex_);
    if (!slots_.take(uid)) {
        return 0;
    }
    connections_.emplace(connection.get(), Entry{connection, uid});
    return connections_.size();
}

std::size_t IpcServiceCore::remove(const AsioIpcConnection* connection) {
    std::lock_guard lock(connectionsMutex_);
    const auto found = connections_.find(connection);
    if (found != connections_.end()) {
        slots_.release(found->second.uid);
        connections_.erase(found);
    }
    return connections_.size();
}

std::vector<std::shared_ptr<AsioIpcConnection>>
IpcServiceCore::idleConnections(std::chrono::steady_clock::time_point cutoff,
                                std::size_t keep) const {
    // Looked at outside the lock: a connection whose last holder is this
    // call would remove itself from the set when released.
    std::vector<std::pair<std::shared_ptr<AsioIpcConnection>, uid_t>> open;
    std::vector<uid_t> uids;
    {
        std::lock_guard lock(connectionsMutex_);
        if (connections_.size() <= keep) {
            return {};
        }
        uids = slots_.uidsByUse();
        for (const auto& [key, entry] : connections_) {
            if (auto connection = entry.connection.lock()) {
                open.emplace_back(std::move(connection), entry.uid);
            }
        }
    }
    const std::size_t wanted = open.size() > keep ? open.size() - keep : 0;
    std::vector<std::shared_ptr<AsioIpcConnection>> idle;
    for (const uid_t uid : uids) {
        for (auto& [connection, owner] : open) {
            if (idle.size() == wanted) {
                return idle;
            }
            if (owner == uid && connection->idleSince(cutoff)) {
                idle.push_back(connection);
            }
        }
    }
    return idle;
}

void IpcServiceCore::trimNow() {
    lastTrim_.store(std::chrono::steady_clock::now().time_since_epoch().count(),
                    std::memory_order_relaxed);
    ::malloc_trim(0);
}

void IpcServiceCore::trimMemory() {
    const auto now = std::chrono::steady_clock::now();
    const auto last = std::chrono::steady_clock::time_point(
        std::chrono::steady_clock::duration(lastTrim_.load(std::memory_order_relaxed)));
    std::lock_guard lock(trimMutex_);
    if (trimPending_) {
        return; // the trim at the end of the interval frees this too
    }
    if (last.time_since_epoch().count() == 0 || now - last >= memoryTrimInterval_) {
        trimNow();
        return;
    }
    {
        std::lock_guard gate(gateMutex_);
        if (gateClosed_) {
            return;
        }
    }
    trimPending_ = true;
    trimTimer_->expires_at(last + memoryTrimInterval_);
    trimTimer_->async_wait([this](const asio::error_code& error) {
        std::lock_guard lock(trimMutex_);
        trimPending_ = false;
        if (!error) {
            trimNow();
        }
    });
}

std::size_t IpcServiceCore::openCount() const {
    std::lock_guard lock(connectionsMutex_);
    return connections_.size();
}

std::vector<std::shared_ptr<AsioIpcConnection>> IpcServiceCore::connections() const {
    std::vector<std::shared_ptr<AsioIpcConnection>> open;
    std::lock_guard lock(connectionsMutex_);
    open.reserve(connections_.size());
    for (const auto& [key, entry] : connections_) {
        if (auto connection = entry.connection.lock()) {
            open.push_back(std::move(connection));
        }
    }
    return open;
}

} // namespace quarn
