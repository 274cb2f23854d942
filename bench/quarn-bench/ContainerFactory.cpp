#include "ContainerFactory.h"

#include "Fail.h"

#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/PropertyList.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace quarn::loadbench {

ContainerFactory::ContainerFactory() : user_(QRNUserIdentitySharedCache::defaultUserIdentity()) {}

std::filesystem::path ContainerFactory::classDirectory(std::uint64_t containerClass) const {
    auto directory = QRNGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
        user_, containerClass, false);
    if (!directory) {
        fail("no directory for class {}", containerClass);
    }
    return *directory;
}

std::vector<std::uint8_t> ContainerFactory::metadataBytes(std::uint64_t containerClass,
                                                          const std::string& identifier,
                                                          const std::filesystem::path& url) const {
    auto uuid = UUID::parse(url.filename().string());
    auto identity = QRNConcreteContainerIdentity::containerIdentityWithUUID(
        uuid.value_or(UUID::random()), user_, identifier, containerClass);
    if (!identity) {
        fail("cannot make an identity for {}", identifier);
    }
    auto bytes =
        binaryPropertyList(QRNMetadata(*identity, Value(), url, std::nullopt).dictionary());
    if (!bytes) {
        fail("cannot encode the metadata of {}", identifier);
    }
    return std::move(*bytes);
}

void ContainerFactory::make(std::uint64_t containerClass, const std::string& prefix,
                            int count) const {
    const auto directory = classDirectory(containerClass);
    for (int i = 0; i < count; ++i) {
        const auto url = directory / UUID::random().string();
        const auto bytes = metadataBytes(containerClass, prefix + std::to_string(i), url);
        const auto file = url / QRNMetadata::kFileName;
        if (::mkdir(url.c_str(), 0755) != 0) {
            fail("mkdir {}: {}", url.string(), std::strerror(errno));
        }
        int fd = ::open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
        if (fd < 0 ||
            ::write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()) ||
            ::close(fd) != 0) {
            fail("writing {}: {}", file.string(), std::strerror(errno));
        }
    }
}

} // namespace quarn::loadbench
