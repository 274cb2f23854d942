#pragma once
// Reads the code-signing registry directory: one property list per entry,
// "*.plist", in file-name order. Entries that fail validation are skipped
// with a log line naming their file; of two entries for one "Program" the
// later file wins.

#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/platform/EntitlementHolders.h"
#include "Daemon/platform/ExecutableDigestCache.h"

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

struct CodeSigningRegistryEntry {
    std::string program;
    std::optional<ExecutableDigestCache::Digest> sha256;
    CodeSigningInfo info;
    EntitlementHolders holders;
    std::string fileName; // for log lines
};

class CodeSigningRegistryLoader {
public:
    // An entry file never needs more; anything bigger is refused unread.
    static constexpr std::size_t kMaxEntryFileSize = 1u << 20;

    // Entries by "Program".
    using Table =
        std::map<std::string, std::shared_ptr<const CodeSigningRegistryEntry>, std::less<>>;

    // `requireRootOwned`: refuse a directory or file that is not owned by
    // root or that group or others may write.
    static Table load(const std::filesystem::path& directory, bool requireRootOwned);

    // The entry a property list describes, or the reason it is refused.
    static std::optional<CodeSigningRegistryEntry>
    entryFromPropertyList(const Value& plist, std::string_view fileName, std::string& problem);

private:
    static std::optional<Value> readEntryFile(int dirfd, const std::string& name,
                                              bool requireRootOwned, std::string& problem);
};

} // namespace quarn
