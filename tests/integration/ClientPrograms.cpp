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

constexpr std::string_view kEntitlementPrefix = "com.orvex.private.Quarn.";

enum class Digest { None, OfProgram, Wrong };

struct Definition {
    std::string_view name;
    Value entitlements; // none: the entry has no "Entitlements"
    Digest digest = Digest::None;
};

std::string entitlement(std::string_view name) {
    return std::string(kEntitlementPrefix) + std::string(name);
}

Value granting(std::string_view name, Value value) {
    return Value(Value::Dictionary{{entitlement(name), std::move(value)}});
}

std::vector<Definition> definitions() {
    using P = ClientPrograms;
    const Value allowed = granting("allowed", true);
    const Value lookup = Value(
        Value::Dictionary{{"appData", Value(Value::Array{Value(P::identifierOf(P::kAllowed))})}});
    return {
        {P::kAllowed, allowed, Digest::OfProgram},
        {P::kNone, Value(), Digest::None},
        {P::kLookup, granting("lookup", lookup), Digest::None},
        {P::kWipeBool, granting("wipeContainer", true), Digest::None},
        {P::kWipeArray,
         granting("wipeContainer", Value(Value::Array{Value(P::identifierOf(P::kWipeArray))})),
         Digest::None},
        {P::kTestability, granting("testability", true), Digest::None},
        {P::kBadDigest, allowed, Digest::Wrong},
    };
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

std::filesystem::path testBinary() {
    return std::filesystem::read_symlink("/proc/self/exe");
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
    const std::string programDigest = hexDigestOf(clientProgram);
    for (const Definition& definition : definitions()) {
        install(clientProgram, definition.name);
        Value::Dictionary entry{{"Program", pathOf(definition.name).string()},
                                {"Identifier", identifierOf(definition.name)}};
        if (!definition.entitlements.isNone()) {
            entry.emplace("Entitlements", definition.entitlements);
        }
        if (definition.digest != Digest::None) {
            entry.emplace("SHA256", definition.digest == Digest::OfProgram ? programDigest
                                                                           : std::string(64, '0'));
        }
        writeEntry(registry, definition.name, std::move(entry));
    }
    writeEntry(registry, "test-binary",
               {{"Program", testBinary().string()},
                {"Identifier", std::string(kTestBinaryIdentifier)},
                {"Entitlements", granting("allowed", true)}});
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
