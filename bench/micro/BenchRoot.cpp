#include "BenchRoot.h"

#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"

#include <cstdio>
#include <cstdlib>

namespace quarn::bench {

BenchRoot& BenchRoot::shared() {
    static BenchRoot root;
    return root;
}

BenchRoot::BenchRoot() : root_(test::ScratchRoot::Options{}, "quarn-micro") {}

QRNUserIdentityPtr BenchRoot::mobile() {
    return QRNUserIdentitySharedCache::defaultUserIdentity();
}

QRNMetadataPtr BenchRoot::makeContainer(std::uint64_t containerClass,
                                        const std::string& identifier) {
    const UUID uuid = UUID::random();
    auto classDirectory =
        QRNGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            mobile(), containerClass, false);
    auto identity = QRNConcreteContainerIdentity::containerIdentityWithUUID(
        uuid, mobile(), identifier, containerClass);
    if (!classDirectory || !identity) {
        std::fprintf(stderr, "cannot make a container of class %llu\n",
                     static_cast<unsigned long long>(containerClass));
        std::exit(1);
    }
    const auto url = *classDirectory / uuid.string();
    std::filesystem::create_directories(url);
    auto metadata = std::make_shared<const QRNMetadata>(*identity, Value(), url, std::nullopt);
    if (!metadata->writeMetadataToFileURL(url / QRNMetadata::kFileName)) {
        std::fprintf(stderr, "cannot write metadata at %s\n", url.c_str());
        std::exit(1);
    }
    return metadata;
}

} // namespace quarn::bench
