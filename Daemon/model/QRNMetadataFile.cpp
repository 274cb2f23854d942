#include "Daemon/model/QRNMetadataFile.h"

#include "Daemon/fs/EnvFd.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <span>

namespace quarn {

namespace {

// Making the error logs it.
Error untrusted(const std::string& path, const std::string& why) {
    return QRN_ERROR(kQRNErrorReadPlistFailed, "Untrusted metadata file {}: {}", path, why);
}

Error failed(const std::string& path, const char* what, int err) {
    return untrusted(path, fmt::format("{} failed: {}", what, std::strerror(err)));
}

} // namespace

Result<PropertyListPtr> QRNMetadataFile::readTrusted(Env& env, const PathResolver& resolver,
                                                     const std::string& path) {
    auto bytes = readBytes(env, resolver, path);
    if (!bytes) {
        return QRN_UNEXPECTED(bytes.error());
    }
    const auto* data = reinterpret_cast<const std::uint8_t*>(bytes->data());
    auto root = propertyListFromBytes(std::span(data, bytes->size()));
    if (!root) {
        return root;
    }
    if (auto checked = checkPropertyList(root->get()); !checked) {
        return QRN_UNEXPECTED(checked.error());
    }
    if (plist_get_node_type(root->get()) != PLIST_DICT) {
        return QRN_UNEXPECTED(untrusted(path, "not a dictionary"));
    }
    return root;
}

Result<std::string> QRNMetadataFile::readBytes(Env& env, const PathResolver& resolver,
                                               const std::string& path) {
    const std::size_t slash = path.rfind('/');
    if (slash == std::string::npos || slash + 1 == path.size()) {
        return QRN_UNEXPECTED(untrusted(path, "not a file path"));
    }
    const std::string directory = slash == 0 ? "/" : path.substr(0, slash);
    const std::string name = path.substr(slash + 1);
    auto dir = resolver.open(directory, O_PATH | O_DIRECTORY | O_NOFOLLOW);
    if (!dir) {
        return QRN_UNEXPECTED(failed(path, "opening its directory", dir.error()));
    }
    EnvFd dirFd = std::move(*dir);
    // Looked at before opening: opening a device or a fifo may act or block.
    auto before = env.fstatat(dirFd.get(), name.c_str(), AT_SYMLINK_NOFOLLOW);
    if (!before) {
        return QRN_UNEXPECTED(failed(path, "stat", before.error()));
    }
    if (auto checked = checkStatus(*before, path); !checked) {
        return QRN_UNEXPECTED(checked.error());
    }
    auto opened =
        env.openat(dirFd.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    if (!opened) {
        return QRN_UNEXPECTED(failed(path, "open", opened.error()));
    }
    EnvFd file(env, *opened);
    auto st = env.fstat(file.get());
    if (!st) {
        return QRN_UNEXPECTED(failed(path, "fstat", st.error()));
    }
    if (auto checked = checkStatus(*st, path); !checked) {
        return QRN_UNEXPECTED(checked.error());
    }
    // One byte more than allowed shows a file that grew since the check.
    std::string bytes(kMaximumSize + 1, '\0');
    std::size_t got = 0;
    while (got < bytes.size()) {
        auto n = env.read(file.get(), bytes.data() + got, bytes.size() - got);
        if (!n) {
            return QRN_UNEXPECTED(failed(path, "read", n.error()));
        }
        if (*n == 0) {
            break;
        }
        got += *n;
    }
    if (got > kMaximumSize) {
        return QRN_UNEXPECTED(untrusted(path, "larger than 64 KiB"));
    }
    bytes.resize(got);
    return bytes;
}

Status QRNMetadataFile::checkStatus(const struct stat& st, const std::string& path) {
    if (!S_ISREG(st.st_mode)) {
        return QRN_UNEXPECTED(
            untrusted(path, fmt::format("not a regular file (mode {:o})", st.st_mode & S_IFMT)));
    }
    if (st.st_uid != 0) {
        return QRN_UNEXPECTED(untrusted(path, fmt::format("owned by uid {}", st.st_uid)));
    }
    if (st.st_nlink != 1) {
        return QRN_UNEXPECTED(untrusted(path, fmt::format("{} links", st.st_nlink)));
    }
    if (st.st_size < 0 || static_cast<std::size_t>(st.st_size) > kMaximumSize) {
        return QRN_UNEXPECTED(untrusted(path, fmt::format("{} bytes", st.st_size)));
    }
    return {};
}

} // namespace quarn
