#include "ClientPrograms.h"

#include "Daemon/support/PropertyList.h"

#include <sodium.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <system_error>

namespace quarn::test {

namespace {

Value granting(std::string_view name, Value value) {
    return Value(
        Value::Dictionary{{"com.orvex.private.Quarn." + std::string(name), std::move(value)}});
}

std::string hexDigestOf(const std::filesystem::path& file) {
    std::ifstream in(file, std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    unsigned char digest[crypto_hash_sha256_BYTES];
    crypto_hash_sha256(digest, reinterpret_cast<const unsigned char*>(bytes.data()), bytes.size());
    char hex[2 * sizeof digest + 1];
    sodium_bin2hex(hex, sizeof hex, digest, sizeof digest);
    return hex;
}

void writeEntry(const std::filesystem::path& registry, std::string_view fileName,
                Value::Dictionary entry) {
    const std::filesystem::path file = registry / (std::string(fileName) + ".plist");
    if (!QRN_writeToURL(Value(std::move(entry)), file)) {
        throw std::runtime_error("cannot write registry entry " + file.string());
    }
}

} // namespace

std::string ClientPrograms::identifierOf(std::string_view name) {
    return "com.orvex.test." + std::string(name);
}

ClientPrograms::ClientPrograms(const std::filesystem::path& clientProgram,
                               const std::filesystem::path& directory,
                               const std::filesystem::path& registry)
    : directory_(directory) {
    [[maybe_unused]] static const int sodiumReady = sodium_init();
    std::filesystem::create_directories(directory_);
    std::filesystem::create_directories(registry);
    const std::string digest = hexDigestOf(clientProgram), wrongDigest(64, '0');
    const Value allowed = granting("allowed", true);
    const Value lookup =
        Value(Value::Dictionary{{"appData", Value::Array{identifierOf(kAllowed)}}});
    // Name, entitlements (none: no entry) and digest (empty: no entry).
    const std::tuple<std::string_view, Value, std::string> programs[] = {
        {kAllowed, allowed, digest},
        {kNone, Value(), ""},
        {kLookup, granting("lookup", lookup), ""},
        {kWipeBool, granting("wipeContainer", true), ""},
        {kWipeArray, granting("wipeContainer", Value::Array{identifierOf(kWipeArray)}), ""},
        {kTestability, granting("testability", true), ""},
        {kBadDigest, allowed, wrongDigest},
    };
    for (const auto& [name, entitlements, sha256] : programs) {
        install(clientProgram, name);
        Value::Dictionary entry{{"Program", pathOf(name).string()},
                                {"Identifier", identifierOf(name)}};
        if (!entitlements.isNone()) {
            entry.emplace("Entitlements", entitlements);
        }
        if (!sha256.empty()) {
            entry.emplace("SHA256", sha256);
        }
        writeEntry(registry, name, std::move(entry));
    }
    writeEntry(registry, "test-binary",
               {{"Program", std::filesystem::read_symlink("/proc/self/exe").string()},
                {"Identifier", std::string(kTestBinaryIdentifier)},
                {"Entitlements", allowed}});
}

void ClientPrograms::install(const std::filesystem::path& clientProgram, std::string_view name) {
    const std::filesystem::path target = pathOf(name);
    if (::link(clientProgram.c_str(), target.c_str()) == 0) {
        return;
    }
    if (errno != EXDEV) {
        throw std::system_error(errno, std::generic_category(), "link " + target.string());
    }
    // Another file system: a copy is a program of its own path just as well.
    std::filesystem::copy_file(clientProgram, target);
    std::filesystem::permissions(target, std::filesystem::perms::owner_all |
                                             std::filesystem::perms::group_read |
                                             std::filesystem::perms::group_exec);
}

} // namespace quarn::test
