#include "Daemon/platform/IpcServiceCore.h"

namespace quarn {

void IpcServiceCore::closeGate() {
    std::lock_guard lock(gateMutex_);
    gateClosed_ = true;
}

std::size_t IpcServiceCore::add(const std::shared_ptr<AsioIpcConnection>& connection) {
    std::lock_guard lock(connectionsMutex_);
    connections_.emplace(connection.get(), connection);
    return connections_.size();
}

std::size_t IpcServiceCore::remove(const AsioIpcConnection* connection) {
    std::lock_guard lock(connectionsMutex_);
    connections_.erase(connection);
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
