#pragma once
// The clients a test daemon knows from its code-signing registry: hard-linked
// copies of quarn_test_client, one per set of entitlements (the kernel
// reports a process's executable by the path it was started from, so each
// link is a program of its own), and the test binary itself with full
// rights, so that the test's threads can talk to the daemon directly.

#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

namespace quarn::test {

class ClientPrograms {
public:
    // "com.orvex.private.Quarn.allowed", with the executable's digest.
    static constexpr std::string_view kAllowed = "allowed";
    // No entitlements at all.
    static constexpr std::string_view kNone = "none";
    // Only a "lookup" dictionary granting class 2 of the allowed client.
    static constexpr std::string_view kLookup = "lookup";
    // "wipeContainer" as a plain true, and as a list naming this client.
    static constexpr std::string_view kWipeBool = "wipe-bool";
    static constexpr std::string_view kWipeArray = "wipe-array";
    // Only "testability".
    static constexpr std::string_view kTestability = "testability";
    // "allowed", but the entry's digest is not the executable's.
    static constexpr std::string_view kBadDigest = "bad-digest";

    static constexpr std::string_view kTestBinaryIdentifier = "com.orvex.test.integration";

    // "com.orvex.test.<name>".
    static std::string identifierOf(std::string_view name);

    // Links `clientProgram` into `directory` once per name and writes the
    // registry entries into `registry`. Throws when that fails.
    ClientPrograms(const std::filesystem::path& clientProgram,
                   const std::filesystem::path& directory, const std::filesystem::path& registry);

    std::filesystem::path pathOf(std::string_view name) const { return directory_ / name; }

private:
    void install(const std::filesystem::path& clientProgram, std::string_view name);

    std::filesystem::path directory_;
};

} // namespace quarn::test
