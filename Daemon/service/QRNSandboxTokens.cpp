#include "Daemon/service/QRNSandboxTokens.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/platform/SandboxExtensions.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

std::string_view QRNSandboxTokens::extensionClassForContainerClass(std::uint64_t containerClass) {
    switch (containerClass) {
    case kQRNContainerClassAppData:
    case kQRNContainerClassPluginData:
    case kQRNContainerClassVPNData:
    case kQRNContainerClassInternalDaemon:
        return SandboxExtensions::kContainerClass;
    case kQRNContainerClassAppGroup:
        return SandboxExtensions::kApplicationGroupClass;
    default:
        return {};
    }
}

std::optional<std::string>
QRNSandboxTokens::sandboxTokenForContainer(const QRNClientConnection& client,
                                           const QRNMetadata& metadata) {
    const QRNClientIdentityPtr& identity = client.clientIdentity();
    if (!identity || !identity->isSandboxed()) {
        return std::nullopt;
    }
    QRNDaemonContext& context = QRNDaemonContext::current();
    // The token names the path as the client's sandbox sees it.
    const std::string path = context.instance<Paths>().devicePath(metadata.url());
    const std::uint64_t containerClass = metadata.containerClass();
    const bool enterprise = metadata.userIdentity() && metadata.userIdentity()->isEnterprise();
    const std::string_view extensionClass = extensionClassForContainerClass(containerClass);
    if (!enterprise || extensionClass.empty()) {
        QRN_LOG_INFO(LogCategory::Sandbox,
                     "{} is sandboxed and container (type: {}) is enterprise: {}. NOT issuing "
                     "token for path: {}",
                     identity->bundleIdentifier(), containerClass, enterprise ? 1 : 0, path);
        return std::nullopt;
    }
    QRN_LOG_INFO(LogCategory::Sandbox,
                 "{} is sandboxed and container (type: {}) is enterprise: {}. Issuing token for "
                 "path: {}",
                 identity->bundleIdentifier(), containerClass, 1, path);
    auto token = context.instance<SandboxExtensions>().issueFileExtension(extensionClass, path,
                                                                          identity->auditToken());
    if (!token) {
        const Error& failure = token.error();
        QRN_LOG_ERROR(LogCategory::Sandbox,
                      "issuing a sandbox extension failed for {} at path {}: {}",
                      identity->bundleIdentifier(), path,
                      failure.domain == Error::Domain::POSIX ? failure.code : 0);
        return std::nullopt;
    }
    return std::move(*token);
}

} // namespace quarn
