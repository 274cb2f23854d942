#pragma once
// Helpers shared by the file manager tests: building small trees and reading
// back what the file manager left on disk.

#include <sys/stat.h>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace quarn::test {

void writeFile(const std::filesystem::path& path, std::string_view contents);
std::string readFile(const std::filesystem::path& path);
struct stat lstatOf(const std::filesystem::path& path);
bool existsNoFollow(const std::filesystem::path& path);
std::optional<std::string> xattrOf(const std::filesystem::path& path, const char* name);
// The attribute holding the data protection class, as root writes it.
inline constexpr const char* kProtectionClassAttribute = "trusted.quarn.protection_class";

} // namespace quarn::test

namespace quarn::test {

// Sets or clears FS_IMMUTABLE_FL; answers the errno (0 on success).
int setImmutable(const std::filesystem::path& path, bool immutable);
// Entries below `dir` (not counting it); -1 when it is missing.
long countEntries(const std::filesystem::path& dir);
// A directory on another file system than the temporary roots (tmpfs in
// /dev/shm), removed at the end of the scope; empty when there is none.
class OtherFileSystemDirectory {
public:
    OtherFileSystemDirectory();
    ~OtherFileSystemDirectory();
    const std::filesystem::path& path() const { return path_; }

private:
    std::filesystem::path path_;
};

} // namespace quarn::test

namespace quarn::test {

// A chain of `depth` nested directories with long names and a file at the
// bottom, made by descriptor: its full path is longer than PATH_MAX.
void makeDeepTree(const std::filesystem::path& top, int depth);

} // namespace quarn::test
