// The dictionary file operations of PropertyList.h.

#include "Daemon/support/PropertyList.h"
#include "Daemon/support/ProtectionClassAttribute.h"

#include "Daemon/support/Descriptor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <random>

namespace quarn {

namespace {

Status writeAll(int fd, std::span<const std::uint8_t> bytes, const std::filesystem::path& path) {
    while (!bytes.empty()) {
        ssize_t n = ::write(fd, bytes.data(), bytes.size());
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            int err = errno;
            return QRN_UNEXPECTED(
                QRN_POSIX_ERROR(err, "Failed to write {}: {}", path.string(), strerror(err)));
        }
        bytes = bytes.subspan(static_cast<std::size_t>(n));
    }
    return {};
}

// Writes the bytes, then gives the file its class and flushes it, then closes.
Status fillFile(Descriptor& fd, std::span<const std::uint8_t> bytes,
                const std::filesystem::path& path, const WriteOptions& options) {
    if (auto written = writeAll(fd.get(), bytes, path); !written) {
        return written;
    }
    if (options.lowestProtection) {
        auto set = ProtectionClassAttribute::setProtectionClass(
            fd.get(), ProtectionClassAttribute::kLowestClass);
        if (!set) {
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(set.error(),
                                                  "Failed to set the protection class of {}: {}",
                                                  path.string(), strerror(set.error())));
        }
    }
    if (options.fsync && ::fsync(fd.get()) != 0) {
        int err = errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "Failed to sync {}: {}", path.string(), strerror(err)));
    }
    if (int err = fd.close()) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "Failed to close {}: {}", path.string(), strerror(err)));
    }
    return {};
}

Status writeInPlace(std::span<const std::uint8_t> bytes, const std::filesystem::path& url,
                    const WriteOptions& options) {
    Descriptor fd(::open(url.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!fd.valid()) {
        int err = errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "Failed to open {} for writing: {}", url.string(), strerror(err)));
    }
    return fillFile(fd, bytes, url, options);
}

// A new file beside the destination: ".<name>.<random>.tmp".
int createTemporary(int dirfd, const std::string& name, std::string& tmpName) {
    thread_local std::mt19937_64 random{std::random_device{}()};
    for (int attempt = 0; attempt < 100; ++attempt) {
        tmpName = fmt::format(".{}.{:016x}.tmp", name.substr(0, 200), random());
        int fd = ::openat(dirfd, tmpName.c_str(),
                          O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644);
        if (fd >= 0 || errno != EEXIST) {
            return fd;
        }
    }
    return -1;
}

Status writeAtomically(std::span<const std::uint8_t> bytes, const std::filesystem::path& url,
                       const WriteOptions& options) {
    std::filesystem::path directory = url.has_parent_path() ? url.parent_path() : ".";
    std::string name = url.filename().string();
    if (name.empty() || name == "." || name == "..") {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EINVAL, "Cannot write a file at {}", url.string()));
    }
    Descriptor dirfd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::string tmpName;
    Descriptor fd(dirfd.valid() ? createTemporary(dirfd.get(), name, tmpName) : -1);
    if (!fd.valid()) {
        int err = errno;
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "Failed to create a temporary file in {}: {}",
                                              directory.string(), strerror(err)));
    }
    Status filled = fillFile(fd, bytes, directory / tmpName, options);
    if (filled && ::renameat(dirfd.get(), tmpName.c_str(), dirfd.get(), name.c_str()) != 0) {
        int err = errno;
        filled = QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "Failed to rename {} to {}: {}", tmpName,
                                                url.string(), strerror(err)));
    }
    if (!filled) {
        ::unlinkat(dirfd.get(), tmpName.c_str(), 0);
        return filled;
    }
    if (options.fsync && ::fsync(dirfd.get()) != 0) {
        int err = errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "Failed to sync {}: {}", directory.string(), strerror(err)));
    }
    return {};
}

Result<std::vector<std::uint8_t>> readFile(const std::string& url) {
    Descriptor fd(::open(url.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    struct stat st;
    int err = !fd.valid() || fstat(fd.get(), &st) != 0 ? errno : 0;
    if (!err && !S_ISREG(st.st_mode)) {
        err = S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
    } else if (!err && static_cast<std::uint64_t>(st.st_size) > kMaxPropertyListFileSize) {
        err = EFBIG;
    }
    std::vector<std::uint8_t> bytes(err ? 0 : static_cast<std::size_t>(st.st_size) + 1);
    std::size_t filled = 0;
    while (!err && filled < bytes.size()) { // one byte more than expected: a growing file
        ssize_t n = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
        if (n < 0 && errno != EINTR) {
            err = errno;
        } else if (n == 0) {
            break;
        } else if (n > 0) {
            filled += static_cast<std::size_t>(n);
        }
    }
    if (!err && filled > kMaxPropertyListFileSize) {
        err = EFBIG;
    }
    if (err) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "Failed to read {}: {}", url, strerror(err)));
    }
    bytes.resize(filled);
    return bytes;
}

} // namespace

Status QRN_writeToURL(const Value& dictionary, const std::filesystem::path& url,
                      WriteOptions options) {
    if (!dictionary.isDictionary()) {
        return QRN_UNEXPECTED(
            Error::make(Error::Domain::General, kGeneralErrorPropertyListWriteInvalid,
                        fmt::format("Refusing to write a {} as a dictionary to {}",
                                    dictionary.kindName(), url.string()),
                        __PRETTY_FUNCTION__, __LINE__));
    }
    auto bytes = binaryPropertyList(dictionary);
    if (!bytes) {
        return QRN_UNEXPECTED(bytes.error());
    }
    return options.atomic ? writeAtomically(*bytes, url, options)
                          : writeInPlace(*bytes, url, options);
}

Result<Value> QRN_dictionaryWithContentsOfURL(const std::filesystem::path& url) {
    auto bytes = readFile(url);
    if (!bytes) {
        return QRN_UNEXPECTED(bytes.error());
    }
    auto value = valueFromPropertyListBytes(*bytes);
    if (!value) {
        return value;
    }
    if (!value->isDictionary()) {
        return QRN_UNEXPECTED(Error::make(Error::Domain::General, kGeneralErrorFileReadCorrupt,
                                          fmt::format("The property list at {} holds a {}, "
                                                      "not a dictionary",
                                                      url.string(), value->kindName()),
                                          __PRETTY_FUNCTION__, __LINE__));
    }
    return value;
}

Result<PropertyListPtr> QRN_dictionaryNodeWithContentsOfFile(const std::string& path) {
    auto bytes = readFile(path);
    if (!bytes) {
        return QRN_UNEXPECTED(bytes.error());
    }
    auto root = propertyListFromBytes(*bytes);
    if (!root) {
        return root;
    }
    if (auto checked = checkPropertyList(root->get()); !checked) {
        return QRN_UNEXPECTED(checked.error());
    }
    if (plist_get_node_type(root->get()) != PLIST_DICT) {
        auto value = valueFromPropertyList(root->get()); // checked: only for its kind's name
        return QRN_UNEXPECTED(Error::make(Error::Domain::General, kGeneralErrorFileReadCorrupt,
                                          fmt::format("The property list at {} holds a {}, "
                                                      "not a dictionary",
                                                      path, value->kindName()),
                                          __PRETTY_FUNCTION__, __LINE__));
    }
    return root;
}

bool containsDotDotPathComponents(std::string_view path) {
    std::size_t start = 0;
    while (start <= path.size()) {
        std::size_t slash = path.find('/', start);
        std::size_t end = slash == std::string_view::npos ? path.size() : slash;
        if (path.substr(start, end - start) == "..") {
            return true;
        }
        start = end + 1;
    }
    return false;
}

} // namespace quarn
