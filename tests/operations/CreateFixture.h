#pragma once
// A temporary root whose file manager runs on a fault-injecting Env, with
// helpers to make client connections and identities and to look at what a
// create-or-lookup left on disk.

#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNClientConnection.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace quarn::test {

inline constexpr const char* kClientBundle = "com.example.client";

class CreateFixture : public ::testing::Test {
protected:
    struct Rights {
        bool allowOtherIdLookup = false;
        bool unrestricted = false;
        std::optional<Value> lookup;
        bool kernel = false;

        static Rights otherIds() {
            Rights rights;
            rights.allowOtherIdLookup = true;
            return rights;
        }
        static Rights everything() {
            Rights rights;
            rights.unrestricted = true;
            return rights;
        }
        static Rights lookingUp(Value lookup) {
            Rights rights;
            rights.lookup = std::move(lookup);
            return rights;
        }
    };

    CreateFixture();
    ~CreateFixture() override;

    std::shared_ptr<QRNClientConnection> connectionFor(const std::string& bundleIdentifier,
                                                       Rights rights);
    std::shared_ptr<QRNClientConnection> connectionFor(const std::string& bundleIdentifier) {
        return connectionFor(bundleIdentifier, Rights{});
    }
    std::shared_ptr<QRNClientConnection> privileged() {
        return connectionFor(kClientBundle, Rights::everything());
    }

    QRNUserIdentityPtr user() const;
    QRNContainerIdentityPtr identity(const std::string& identifier, std::uint64_t cls) const;

    // Creates (or finds) with an unrestricted connection; fails the test on error.
    QRNMetadataPtr create(const std::string& identifier, std::uint64_t cls, bool transient = false);

    std::filesystem::path classDirectory(std::uint64_t cls, bool transient = false) const;
    std::filesystem::path stagingDirectory(std::uint64_t cls) const;
    std::filesystem::path deathRow() const;
    // Names directly inside a directory (dot files included); empty when missing.
    static std::vector<std::string> namesIn(const std::filesystem::path& directory);
    // Every item below death row's unique directories, by last component.
    std::vector<std::string> namesOnDeathRow() const;
    // Every Env call made so far, of any kind.
    std::uint64_t totalCalls() const;
    static struct stat lstatOf(const std::filesystem::path& path);
    // Makes the directories a creation needs first, so that fault counts
    // start at the container itself.
    void primeDirectories(std::uint64_t cls, bool transient = false);

    TempRoot root_;
    std::shared_ptr<FaultInjectingEnv> env_;
};

} // namespace quarn::test
