#pragma once
// The staged delete: for each container identity, drop the container's
// code-signing records (bundle classes), move its directory to death row (or
// remove it in place when the move fails) and forget it in the container
// cache. Runs from a request's command queue after the handler, so the
// handler never waits for a tree to go.

#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNCommand.h"
#include "Daemon/support/QRNError.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

namespace quarn {

class QRNCommandStageForDelete : public QRNCommand {
public:
    // Hears the code the command ended with when it failed.
    using ErrorBlock = std::function<void(std::uint64_t)>;

    // Identities may be plain or concrete (naming one directory by UUID).
    // With `useLocking` the command holds the global write lock while it runs.
    static std::shared_ptr<QRNCommandStageForDelete>
    commandForStageForDeleteWithContainerIdentities(
        std::vector<QRNContainerIdentityPtr> containerIdentities, bool useLocking,
        ErrorBlock onError);

    QRNCommandStageForDelete(std::vector<QRNContainerIdentityPtr> containerIdentities,
                             bool useLocking, ErrorBlock onError);

    std::uint64_t command() const override { return kQRNCommandStageForDelete; }
    bool fromQueue(const std::weak_ptr<QRNCommandQueue>& queue, std::uint64_t& error) override;

    const std::vector<QRNContainerIdentityPtr>& containerIdentities() const {
        return containerIdentities_;
    }
    bool useLocking() const { return useLocking_; }

protected:
    // The cache's removal; a seam so a test can make it fail.
    virtual Status removeFromCache(const QRNContainerIdentity& identity, bool transient);

private:
    // A container found for an identity, and which cache holds it.
    struct Found {
        QRNMetadataPtr metadata;
        bool transient = false;
    };

    // Every identity in order; stops at the first cache removal failure.
    Status stageAll(const std::shared_ptr<QRNCommandQueue>& queue);
    // Nothing when the identity names no cached container.
    static std::optional<Found> findContainer(const QRNContainerIdentityPtr& identity);
    static void removeCodeSigningRecords(const QRNContainerIdentity& identity, const Found& found,
                                         const std::shared_ptr<QRNCommandQueue>& queue);
    static bool permanentCopyExists(const QRNContainerIdentity& identity, const Found& found);
    static void moveToDeathRowOrRemove(const std::filesystem::path& url);

    const std::vector<QRNContainerIdentityPtr> containerIdentities_;
    const bool useLocking_;
    const ErrorBlock onError_;
};

} // namespace quarn
