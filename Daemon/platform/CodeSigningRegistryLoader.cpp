#include "Daemon/platform/CodeSigningRegistryLoader.h"

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/PropertyList.h"

#include <dirent.h>
#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <vector>

namespace quarn {

namespace {

// An entry names the programs that get entitlements, so whoever may write
// one may give any program every right of the daemon: when the daemon runs
// as root, only root may be able to change the registry.
std::optional<std::string> ownershipProblem(const struct stat& st, bool requireRootOwned) {
    if (!requireRootOwned) {
        return std::nullopt;
    }
    if (st.st_uid != 0) {
        return fmt::format("owned by uid {}, not root", st.st_uid);
    }
    if (st.st_mode & (S_IWGRP | S_IWOTH)) {
        return fmt::format("writable by group or others (mode {:o})", st.st_mode & 07777);
    }
    return std::nullopt;
}

bool isEntryFileName(const std::string& name) {
    constexpr std::string_view kSuffix = ".plist";
    return name.size() > kSuffix.size() && name.front() != '.' && name.ends_with(kSuffix);
}

// The entry file names of an open directory, sorted bytewise.
std::vector<std::string> entryFileNames(int dirfd) {
    std::vector<std::string> names;
    DIR* dir = ::fdopendir(::dup(dirfd));
    if (!dir) {
        return names;
    }
    while (const dirent* entry = ::readdir(dir)) {
        if (isEntryFileName(entry->d_name)) {
            names.emplace_back(entry->d_name);
        }
    }
    ::closedir(dir);
    std::sort(names.begin(), names.end());
    return names;
}

std::optional<std::vector<std::uint8_t>> readBounded(int fd, std::size_t maxBytes) {
    std::vector<std::uint8_t> bytes;
    std::uint8_t chunk[8192];
    for (;;) {
        const ssize_t n = ::read(fd, chunk, sizeof chunk);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 || bytes.size() + static_cast<std::size_t>(n) > maxBytes) {
            return std::nullopt;
        }
        if (n == 0) {
            return bytes;
        }
        bytes.insert(bytes.end(), chunk, chunk + n);
    }
}

std::optional<ExecutableDigestCache::Digest> digestFromHex(const std::string& hex) {
    ExecutableDigestCache::Digest digest;
    std::size_t decoded = 0;
    const char* end = nullptr;
    if (hex.size() != 2 * digest.size() ||
        sodium_hex2bin(digest.data(), digest.size(), hex.data(), hex.size(), nullptr, &decoded,
                       &end) != 0 ||
        decoded != digest.size() || end != hex.data() + hex.size()) {
        return std::nullopt;
    }
    return digest;
}

const std::string* stringAt(const Value& plist, std::string_view key) {
    const Value* value = plist.get(key);
    return value ? value->asString() : nullptr;
}

// Reads the optional keys; false with `problem` set when one has a wrong type.
bool readOptionalKeys(const Value& plist, CodeSigningRegistryEntry& entry, std::string& problem) {
    if (const Value* sha = plist.get("SHA256")) {
        const std::string* hex = sha->asString();
        entry.sha256 = hex ? digestFromHex(*hex) : std::nullopt;
        if (!entry.sha256) {
            problem = "\"SHA256\" is not 64 hex digits";
            return false;
        }
    }
    if (const Value* entitlements = plist.get("Entitlements")) {
        // The program is still the one named: it keeps its identifier, without rights.
        if (!entitlements->isDictionary()) {
            QRN_LOG_ERROR(LogCategory::Unspecified,
                          "Code-signing entry {}: \"Entitlements\" is a {}, not a dictionary; "
                          "the program gets none",
                          entry.fileName, entitlements->kindName());
        }
        entry.info.entitlements =
            entitlements->isDictionary() ? *entitlements : Value::dictionary();
    }
    auto holders = EntitlementHolders::fromPropertyList(plist, problem);
    if (!holders) {
        return false;
    }
    entry.holders = std::move(*holders);
    if (const Value* sandboxed = plist.get("Sandboxed")) {
        if (!sandboxed->asBool()) {
            problem = "\"Sandboxed\" is not a boolean";
            return false;
        }
        entry.info.sandboxed = *sandboxed->asBool();
    }
    return true;
}

} // namespace

std::optional<CodeSigningRegistryEntry>
CodeSigningRegistryLoader::entryFromPropertyList(const Value& plist, std::string_view fileName,
                                                 std::string& problem) {
    const std::string* program = stringAt(plist, "Program");
    const std::string* identifier = stringAt(plist, "Identifier");
    if (!program || program->empty() || program->front() != '/' ||
        program->find('\0') != std::string::npos) {
        problem = "\"Program\" is not an absolute path";
        return std::nullopt;
    }
    if (!identifier || identifier->empty()) {
        problem = "\"Identifier\" is not a non-empty string";
        return std::nullopt;
    }
    CodeSigningRegistryEntry entry;
    entry.program = *program;
    entry.info.identifier = *identifier;
    entry.fileName = std::string(fileName);
    if (!readOptionalKeys(plist, entry, problem)) {
        return std::nullopt;
    }
    return entry;
}

std::optional<Value> CodeSigningRegistryLoader::readEntryFile(int dirfd, const std::string& name,
                                                              bool requireRootOwned,
                                                              std::string& problem) {
    // O_NONBLOCK: a FIFO planted in the directory must not hang the daemon.
    Descriptor fd(::openat(dirfd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat st {};
    if (!fd.valid() || ::fstat(fd.get(), &st) != 0) {
        problem = std::strerror(errno);
        return std::nullopt;
    }
    if (!S_ISREG(st.st_mode)) {
        problem = "not a regular file";
        return std::nullopt;
    }
    if (auto refused = ownershipProblem(st, requireRootOwned)) {
        problem = *refused;
        return std::nullopt;
    }
    auto bytes = readBounded(fd.get(), kMaxEntryFileSize);
    if (!bytes) {
        problem = "unreadable or too large";
        return std::nullopt;
    }
    auto value = valueFromPropertyListBytes(*bytes);
    if (!value || !value->isDictionary()) {
        problem = value ? "not a dictionary" : value.error().message;
        return std::nullopt;
    }
    return *value;
}

CodeSigningRegistryLoader::Table
CodeSigningRegistryLoader::load(const std::filesystem::path& directory, bool requireRootOwned) {
    Table table;
    Descriptor dirfd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    struct stat st {};
    if (!dirfd.valid() || ::fstat(dirfd.get(), &st) != 0) {
        if (errno != ENOENT) {
            QRN_LOG_ERROR(LogCategory::Unspecified, "Cannot read code-signing registry {}: {}",
                          directory.string(), std::strerror(errno));
        }
        return table;
    }
    if (auto refused = ownershipProblem(st, requireRootOwned)) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Ignoring code-signing registry {}: {}",
                      directory.string(), *refused);
        return table;
    }
    for (const std::string& name : entryFileNames(dirfd.get())) {
        std::string problem;
        std::optional<CodeSigningRegistryEntry> entry;
        if (auto plist = readEntryFile(dirfd.get(), name, requireRootOwned, problem)) {
            entry = entryFromPropertyList(*plist, name, problem);
        }
        if (!entry) {
            QRN_LOG_ERROR(LogCategory::Unspecified, "Skipping code-signing entry {}: {}",
                          (directory / name).string(), problem);
            continue;
        }
        auto& slot = table[entry->program];
        if (slot) {
            QRN_LOG_NOTICE(LogCategory::Unspecified,
                           "Code-signing entry {} replaces {} for program {}", name, slot->fileName,
                           entry->program);
        }
        slot = std::make_shared<const CodeSigningRegistryEntry>(std::move(*entry));
    }
    QRN_LOG_INFO(LogCategory::Unspecified, "Loaded {} code-signing entries from {}", table.size(),
                 directory.string());
    return table;
}

} // namespace quarn
