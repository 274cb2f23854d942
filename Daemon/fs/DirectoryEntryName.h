#pragma once
// Entry names the tree walks of the file manager treat specially.

#include <string_view>

namespace quarn::DirectoryEntryName {

// "." and "..", which no walk enters.
inline bool isDot(const char* name) {
    return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

// The metadata file at the top of every container: the walks that change
// owners, modes and access lists leave it as the daemon wrote it.
inline constexpr std::string_view kMetadataFile = ".com.orvex.quarn_store.metadata.plist";

} // namespace quarn::DirectoryEntryName
