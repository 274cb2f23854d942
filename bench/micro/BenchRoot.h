#pragma once
// A throw-away root prefix shared by every micro-benchmark of one run: its
// own etc/passwd and etc/group (user "mobile" 501/501, home
// "/private/var/mobile", group "systemusers"), a daemon context with the
// Linux platform made current on it. Made on first use, removed at exit.

#include "Daemon/model/QRNMetadata.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <filesystem>
#include <memory>
#include <string>

namespace quarn::bench {

class BenchRoot {
public:
    static BenchRoot& shared();
    ~BenchRoot();
    BenchRoot(const BenchRoot&) = delete;
    BenchRoot& operator=(const BenchRoot&) = delete;

    const std::filesystem::path& path() const { return root_; }
    QRNDaemonContext& context() { return *context_; }
    // The mobile user's identity.
    QRNUserIdentityPtr mobile();

    // A container of the class for the mobile user, named by a fresh UUID in
    // its class directory, with a metadata file written the daemon's way.
    QRNMetadataPtr makeContainer(std::uint64_t containerClass, const std::string& identifier);

private:
    BenchRoot();

    std::filesystem::path root_;
    std::shared_ptr<QRNDaemonContext> context_;
};

} // namespace quarn::bench
