#pragma once
// Helpers shared by the file manager tests: building small trees and reading
// back what the file manager left on disk.

#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <acl/libacl.h>
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/xattr.h>

#include <cstdio>
#include <fstream>

namespace quarn::test {

namespace fs = std::filesystem;

// The attribute holding the data protection class, as root writes it.
inline constexpr const char* kProtectionClassAttribute = "trusted.quarn.protection_class";

inline void writeFile(const fs::path& path, std::string_view contents) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    if (!(out << contents))
        ADD_FAILURE() << "cannot write " << path;
}

inline std::string readFile(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

inline struct stat lstatOf(const fs::path& path) {
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0)
        ADD_FAILURE() << "lstat " << path << ": " << std::strerror(errno);
    return st;
}

inline bool existsNoFollow(const fs::path& path) {
    struct stat st {};
    return ::lstat(path.c_str(), &st) == 0;
}

inline std::optional<std::string> xattrOf(const fs::path& path,
                                          const char* name = kProtectionClassAttribute) {
    char buffer[256];
    auto n = ::lgetxattr(path.c_str(), name, buffer, sizeof buffer);
    return n < 0 ? std::nullopt : std::optional(std::string(buffer, static_cast<std::size_t>(n)));
}

// "mode uid:gid class" of `p`, e.g. "711 501:501 3" ("-" when it has no class).
inline std::string describe(const fs::path& p) {
    auto st = lstatOf(p);
    char text[64];
    std::snprintf(text, sizeof text, "%o %u:%u ", st.st_mode & 07777, st.st_uid, st.st_gid);
    return text + xattrOf(p).value_or("-");
}

// The ACL of `type` in its short numeric form ("u::rw-,g:1501:rwx,..."), "" when none.
inline std::string aclText(const fs::path& p, acl_type_t type = ACL_TYPE_ACCESS) {
    acl_t acl = ::acl_get_file(p.c_str(), type);
    char* text =
        acl ? ::acl_to_any_text(acl, nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS) : nullptr;
    std::string result = text ? text : "";
    ::acl_free(text);
    ::acl_free(acl);
    return result;
}

// Passes when `result` failed with POSIX `err` and, when one is given, exactly `message`.
template <class Result>
testing::AssertionResult failedWith(const Result& result, int err,
                                    const std::string& message = {}) {
    if (result)
        return testing::AssertionFailure() << "it succeeded";
    const auto& e = result.error();
    if (!e.isPOSIX(err) || (!message.empty() && e.message != message))
        return testing::AssertionFailure() << e.description() << ": " << e.message;
    return testing::AssertionSuccess();
}

// Sets or clears FS_IMMUTABLE_FL; answers the errno (0 on success).
inline int setImmutable(const fs::path& path, bool immutable) {
    int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0)
        return errno;
    int flags = 0;
    int err = ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0 ? 0 : errno;
    flags = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
    if (err == 0 && ::ioctl(fd, FS_IOC_SETFLAGS, &flags) != 0)
        err = errno;
    ::close(fd);
    return err;
}

// Entries below `dir` (not counting it); -1 when it is missing.
inline long countEntries(const fs::path& dir) {
    if (!existsNoFollow(dir))
        return -1;
    std::error_code ec;
    long n = 0;
    for (auto it = fs::recursive_directory_iterator(dir, ec);
         it != fs::recursive_directory_iterator(); it.increment(ec))
        ++n;
    return n;
}

// A chain of `depth` nested directories with long names and a file at the
// bottom, made by descriptor: its full path is longer than PATH_MAX.
inline void makeDeepTree(const fs::path& top, int depth, std::size_t nameLength = 40) {
    fs::create_directories(top);
    int fd = ::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    const std::string name(nameLength, 'n');
    for (int i = 0; i < depth; ++i) {
        ASSERT_EQ(::mkdirat(fd, name.c_str(), 0755), 0) << "level " << i;
        int next = ::openat(fd, name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        ::close(fd);
        ASSERT_GE(next, 0);
        fd = next;
    }
    int file = ::openat(fd, "bottom", O_WRONLY | O_CREAT | O_CLOEXEC, 0644);
    ASSERT_GE(file, 0);
    ASSERT_EQ(::write(file, "deep", 4), 4);
    ::close(file);
    ::close(fd);
}

// A file manager over a fault-injecting Env (no faults until asked) in a
// throw-away root, with the log it writes.
class FsTest : public TempRootTest {
protected:
    LogCapture log_;
    std::shared_ptr<FaultInjectingEnv> env_ =
        std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager manager_{root_.context(), env_};
};

} // namespace quarn::test
