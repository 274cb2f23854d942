#pragma once
// The throw-away root shared by every micro-benchmark of one run, with a
// daemon context current on it; made on first use, removed at exit.

#include "Daemon/model/QRNMetadata.h"
#include "common/shared/ScratchRoot.h"

#include <string>

namespace quarn::bench {

class BenchRoot {
public:
    static BenchRoot& shared();

    // The mobile user's identity.
    QRNUserIdentityPtr mobile();

    // A container of the class for the mobile user, named by a fresh UUID in
    // its class directory, with a metadata file written the daemon's way.
    QRNMetadataPtr makeContainer(std::uint64_t containerClass, const std::string& identifier);

private:
    BenchRoot();

    test::ScratchRoot root_;
};

} // namespace quarn::bench
