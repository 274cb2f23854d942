#pragma once
// A temporary root whose file manager runs on a fault-injecting Env, with
// helpers to make client connections and identities and to look at what the
// operations left on disk.

#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNClientConnection.h"

#include "common/LogCapture.h"
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

struct Rights {
    bool otherIds = false;
    bool unrestricted = false;
    std::optional<Value> lookup = std::nullopt;
};

class CreateFixture : public ::testing::Test {
protected:
    // Unless `holdDeathRow` is false, death row keeps what it receives until
    // the fixture ends, so tests can look at it.
    explicit CreateFixture(bool holdDeathRow = true);
    ~CreateFixture() override;

    std::shared_ptr<QRNClientConnection> connectionFor(const std::string& bundleIdentifier,
                                                       Rights rights = {});
    std::shared_ptr<QRNClientConnection> privileged() {
        return connectionFor(kClientBundle, {.unrestricted = true});
    }
    static QRNClientConnection& shared() { return QRNClientConnection::sharedClientConnection(); }

    static QRNUserIdentityPtr user();
    static QRNContainerIdentityPtr identity(const std::string& identifier, std::uint64_t cls);

    // Creates (or finds) with an unrestricted connection; fails the test on error.
    QRNMetadataPtr create(const std::string& identifier, std::uint64_t cls, bool transient = false);
    static bool cached(const QRNContainerIdentityPtr& identity, bool transient = false);

    static std::filesystem::path classDirectory(std::uint64_t cls, bool transient = false);
    static std::filesystem::path stagingDirectory(std::uint64_t cls);
    static std::filesystem::path deathRow();
    // Names directly inside a directory (dot files included); empty when missing.
    static std::vector<std::string> namesIn(const std::filesystem::path& directory);
    // Every item below death row's unique directories, by last component.
    static std::vector<std::string> namesOnDeathRow();
    // A directory holding a subdirectory with a file.
    static std::filesystem::path makeTree(const std::filesystem::path& directory);
    // Waits for the background passes queued so far.
    static void drainBackground();
    // Every Env call made so far, of any kind.
    std::uint64_t totalCalls() const;
    static struct stat lstatOf(const std::filesystem::path& path);
    // Makes the directories a creation needs first, so that fault counts
    // start at the container itself.
    void primeDirectories(std::uint64_t cls, bool transient = false);

    const bool holdDeathRow_;
    TempRoot root_;
    std::shared_ptr<FaultInjectingEnv> env_;
};

} // namespace quarn::test
