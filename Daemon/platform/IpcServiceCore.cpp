#include "Daemon/platform/IpcServiceCore.h"

#include <algorithm>

namespace quarn {

IpcServiceCore::IpcServiceCore(std::size_t contexts) {
    contexts_.reserve(std::max<std::size_t>(1, contexts));
    for (std::size_t i = 0; i < std::max<std::size_t>(1, contexts); ++i) {
        // One thread runs each context.
        contexts_.push_back(std::make_unique<asio::io_context>(1));
    }
}

asio::io_context& IpcServiceCore::nextContext() {
    return *contexts_[nextContext_.fetch_add(1, std::memory_order_relaxed) % contexts_.size()];
}

bool IpcServiceCore::runningOnPool() const {
    return std::any_of(contexts_.begin(), contexts_.end(), [](const auto& context) {
        return context->get_executor().running_in_this_thread();
    });
}

void IpcServiceCore::closeGate() {
    std::lock_guard lock(gateMutex_);
    gateClosed_ = true;
}

std::size_t IpcServiceCore::add(const std::shared_ptr<AsioIpcConnection>& connection,
                                std::size_t maxOpen) {
    std::lock_guard lock(connectionsMutex_);
    if (connections_.size() >= maxOpen) {
        return 0;
    }
    connections_.emplace(connection.get(), connection);
    return connections_.size();
}

std::size_t IpcServiceCore::remove(const AsioIpcConnection* connection) {
    std::lock_guard lock(connectionsMutex_);
    connections_.erase(connection);
    return connections_.size();
}

std::size_t IpcServiceCore::openCount() const {
    std::lock_guard lock(connectionsMutex_);
    return connections_.size();
}

std::vector<std::shared_ptr<AsioIpcConnection>> IpcServiceCore::connections() const {
    std::vector<std::shared_ptr<AsioIpcConnection>> open;
    std::lock_guard lock(connectionsMutex_);
    open.reserve(connections_.size());
    for (const auto& [key, weak] : connections_) {
        if (auto connection = weak.lock()) {
            open.push_back(std::move(connection));
        }
    }
    return open;
}

} // namespace quarn
