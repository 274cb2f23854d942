#include "FsTestSupport.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>
#include <sys/xattr.h>

namespace quarn::test {

void writeFile(const std::filesystem::path& path, std::string_view contents) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << contents;
    if (!out) {
        ADD_FAILURE() << "cannot write " << path;
    }
}

std::string readFile(const std::filesystem::path& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream buffer;
    buffer << in.rdbuf();
    return buffer.str();
}

struct stat lstatOf(const std::filesystem::path& path) {
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0) {
        ADD_FAILURE() << "lstat " << path << ": " << std::strerror(errno);
    }
    return st;
}

bool existsNoFollow(const std::filesystem::path& path) {
    struct stat st {};
    return ::lstat(path.c_str(), &st) == 0;
}

std::optional<std::string> xattrOf(const std::filesystem::path& path, const char* name) {
    char buffer[256];
    auto n = ::lgetxattr(path.c_str(), name, buffer, sizeof buffer);
    if (n < 0) {
        return std::nullopt;
    }
    return std::string(buffer, static_cast<std::size_t>(n));
}

} // namespace quarn::test

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

namespace quarn::test {

int setImmutable(const std::filesystem::path& path, bool immutable) {
    int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    int flags = 0;
    int err = 0;
    if (::ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) {
        err = errno;
    } else {
        flags = immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
        if (::ioctl(fd, FS_IOC_SETFLAGS, &flags) != 0) {
            err = errno;
        }
    }
    ::close(fd);
    return err;
}

long countEntries(const std::filesystem::path& dir) {
    std::error_code ec;
    if (!existsNoFollow(dir)) {
        return -1;
    }
    long n = 0;
    for (auto it = std::filesystem::recursive_directory_iterator(dir, ec);
         it != std::filesystem::recursive_directory_iterator(); it.increment(ec)) {
        ++n;
    }
    return n;
}

OtherFileSystemDirectory::OtherFileSystemDirectory() {
    struct stat shm {};
    struct stat tmp {};
    if (::stat("/dev/shm", &shm) != 0 ||
        ::stat(std::filesystem::temp_directory_path().c_str(), &tmp) != 0 ||
        shm.st_dev == tmp.st_dev) {
        return;
    }
    std::string tmpl = "/dev/shm/quarn-test.XXXXXX";
    if (::mkdtemp(tmpl.data())) {
        path_ = tmpl;
    }
}

OtherFileSystemDirectory::~OtherFileSystemDirectory() {
    if (!path_.empty()) {
        std::error_code ec;
        std::filesystem::remove_all(path_, ec);
    }
}

} // namespace quarn::test

namespace quarn::test {

void makeDeepTree(const std::filesystem::path& top, int depth) {
    std::filesystem::create_directories(top);
    int fd = ::open(top.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    const std::string name(40, 'n');
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

} // namespace quarn::test
