#include "Client/QRNSandboxTokenVerifier.h"

#include "Daemon/platform/ConfigFile.h"
#include "Daemon/platform/LinuxSandboxExtensions.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/platform/SandboxExtensionToken.h"

#include <algorithm>
#include <cstring>

namespace quarn {

Result<bool> QRNSandboxTokenVerifier::verifySandboxToken(std::string_view token,
                                                         const std::filesystem::path& rootPrefix) {
    auto keyFile = Paths(rootPrefix).runDirectory() / LinuxSandboxExtensions::kKeyFileName;
    auto bytes =
        ConfigFile::read(keyFile, ConfigFile::Links::Refuse, SandboxExtensionToken::kKeySize);
    if (!bytes) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(bytes.error(), "cannot read the key file {}: {}",
                                              keyFile.string(), std::strerror(bytes.error())));
    }
    if (bytes->size() != SandboxExtensionToken::kKeySize) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EINVAL, "the key file {} holds {} bytes, not {}",
                                              keyFile.string(), bytes->size(),
                                              SandboxExtensionToken::kKeySize));
    }
    SandboxExtensionToken::Key key{};
    std::copy(bytes->begin(), bytes->end(), key.begin());
    return SandboxExtensionToken::verify(token, key);
}

} // namespace quarn
