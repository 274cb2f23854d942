#include "BenchRoot.h"

#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/platform/LinuxPlatform.h"
#include "Daemon/platform/Paths.h"

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <stdlib.h>

namespace quarn::bench {

namespace {

void writeFile(const std::filesystem::path& path, const char* contents) {
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path, std::ios::trunc) << contents;
}

} // namespace

BenchRoot& BenchRoot::shared() {
    static BenchRoot root;
    return root;
}

BenchRoot::BenchRoot() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "quarn-micro.XXXXXX").string();
    if (!mkdtemp(tmpl.data())) {
        std::perror("mkdtemp");
        std::exit(1);
    }
    root_ = tmpl;
    Paths paths(root_);
    writeFile(paths.resolve("/etc/passwd"),
              "root:x:0:0:root:/private/var/root:/bin/sh\n"
              "_installd:x:33:33:installer:/private/var/installer:/bin/false\n"
              "mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh\n");
    writeFile(paths.resolve("/etc/group"), "wheel:x:0:\n"
                                           "_installd:x:33:\n"
                                           "mobile:x:501:\n"
                                           "systemusers:x:1501:mobile\n");
    std::filesystem::create_directories(paths.resolve("/private/var/mobile"));
    context_ = std::make_shared<QRNDaemonContext>(root_);
    installLinuxPlatform(*context_);
    QRNDaemonContext::setCurrent(context_);
}

BenchRoot::~BenchRoot() {
    QRNDaemonContext::setCurrent(nullptr);
    context_.reset();
    std::error_code ec;
    std::filesystem::remove_all(root_, ec);
}

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
