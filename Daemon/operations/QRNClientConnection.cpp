#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/protection/QRNDataProtectionManager.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <utility>

namespace quarn {

namespace {

const std::string kNoBundleIdentifier;

} // namespace

QRNClientConnection::QRNClientConnection(
    QRNClientIdentityPtr clientIdentity, bool entitled, bool allowOtherIdLookup, bool unrestricted,
    std::optional<Value> lookup, std::optional<std::vector<std::string>> entitledWipeIdentifiers,
    std::shared_ptr<QRNCommandQueue> commandQueue)
    : clientIdentity_(std::move(clientIdentity)), entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup), unrestricted_(unrestricted),
      lookup_(std::move(lookup)), entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)), deathrowQueue_(_sharedDeathrowQueue()),
      deathrowBackgroundQueue_(_sharedDeathrowBackgroundQueue()),
      backgroundQueue_(_sharedBackgroundQueue()) {}

QRNClientConnection::QRNClientConnection(QRNDaemonContext& context)
    : QRNClientConnection(QRNClientIdentity::anonymousPrivilegedClientIdentity(), true, true, true,
                          std::nullopt, std::nullopt, std::make_shared<QRNCommandQueue>()) {
    // The daemon's own work needs these from the start; bring them up now
    // rather than inside the first request.
    context.instance<QRNGlobalConfiguration>();
    QRNCodeSigningMapping& mapping = context.instance<QRNCodeSigningMapping>();
    context.instance<QRNContainerCache>();
    context.instance<QRNDataProtectionManager>().setEntitlementsSource(
        [&mapping](std::string_view identifier) {
            return mapping.entitlementsForIdentifier(identifier);
        });
}

QRNClientConnection::~QRNClientConnection() = default;

QRNClientConnection& QRNClientConnection::sharedClientConnection() {
    return QRNDaemonContext::current().instance<QRNClientConnection>();
}

std::shared_ptr<QRNClientConnection>
QRNClientConnection::privilegedClientConnectionWithUserIdentity(QRNUserIdentityPtr userIdentity) {
    return std::make_shared<QRNClientConnection>(
        QRNClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity), false),
        true, true, true, std::nullopt, std::nullopt, std::make_shared<QRNCommandQueue>());
}

const std::string& QRNClientConnection::clientBundleIdentifier() const {
    return clientIdentity_ ? clientIdentity_->bundleIdentifier() : kNoBundleIdentifier;
}

QRNUserIdentityPtr QRNClientConnection::userIdentity() const {
    return clientIdentity_ ? clientIdentity_->userIdentity() : nullptr;
}

} // namespace quarn
