#pragma once
// Containers of the mobile user made directly on disk, as the daemon would
// find them: a directory named by a fresh UUID in the class directory and a
// metadata file in the daemon's format. No subdirectories: only the
// metadata matters to a cache rebuild.

#include "Daemon/model/QRNUserIdentity.h"

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

namespace quarn::loadbench {

class ContainerFactory {
public:
    // Uses the current daemon context's layout.
    ContainerFactory();

    std::filesystem::path classDirectory(std::uint64_t containerClass) const;
    // The metadata file of a new container of the class, as bytes.
    std::vector<std::uint8_t> metadataBytes(std::uint64_t containerClass,
                                            const std::string& identifier,
                                            const std::filesystem::path& url) const;
    // `count` containers named "<prefix><n>".
    void make(std::uint64_t containerClass, const std::string& prefix, int count) const;

private:
    QRNUserIdentityPtr user_;
};

} // namespace quarn::loadbench
