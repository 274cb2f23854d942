// How much disk a container takes.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNOperationGuard.h"

namespace quarn {

CodeResult<std::uint64_t> QRNClientConnection::diskUsageWithContainerIdentity(
    const QRNContainerIdentityPtr& containerIdentity) {
    return QRNOperationGuard::run([&]() -> CodeResult<std::uint64_t> {
        auto found = _cachedContainer(containerIdentity, "No Container with identity: ");
        if (!found) {
            return QRN_CODE(found.error());
        }
        const std::filesystem::path& url = (*found)->url();
        const std::int64_t bytes = QRNFileManager::defaultManager().fastDiskUsageForURL(url);
        if (bytes < 0) {
            QRN_ERROR(kQRNErrorInvalidPath, "Failed to get disk usage of {}", url.string());
            return QRN_CODE(kQRNErrorInvalidPath);
        }
        return static_cast<std::uint64_t>(bytes);
    });
}

} // namespace quarn
