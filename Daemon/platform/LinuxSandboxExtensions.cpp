#include "Daemon/platform/LinuxSandboxExtensions.h"

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/Log.h"

#include <fcntl.h>
#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace quarn {

namespace {

using Key = SandboxExtensionToken::Key;

struct KeyFileRead {
    enum class State { Usable, Absent, Unusable, Failed };
    State state = State::Failed;
    Key key{};
    int error = 0;
};

bool readExactly(int fd, std::uint8_t* out, std::size_t size) {
    std::size_t filled = 0;
    while (filled < size) {
        const ssize_t n = ::read(fd, out + filled, size - filled);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        filled += static_cast<std::size_t>(n);
    }
    return true;
}

// A key file counts only when it is ours, private and exactly one key long;
// anything else (a half-written file of a crashed writer, a file others can
// read) is replaced.
KeyFileRead readKeyFile(int dirfd, const char* name) {
    KeyFileRead result;
    Descriptor fd(::openat(dirfd, name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    if (!fd.valid()) {
        result.error = errno;
        result.state = errno == ENOENT  ? KeyFileRead::State::Absent
                       : errno == ELOOP ? KeyFileRead::State::Unusable
                                        : KeyFileRead::State::Failed;
        return result;
    }
    struct stat st {};
    if (::fstat(fd.get(), &st) != 0) {
        result.error = errno;
        return result;
    }
    const bool fits = S_ISREG(st.st_mode) && st.st_uid == ::geteuid() && (st.st_mode & 077) == 0 &&
                      st.st_size == static_cast<off_t>(Key{}.size());
    result.state = fits && readExactly(fd.get(), result.key.data(), result.key.size())
                       ? KeyFileRead::State::Usable
                       : KeyFileRead::State::Unusable;
    return result;
}

// A fresh private file beside the key file holding `key`, fully written.
int writeTemporaryKey(int dirfd, const Key& key, std::string& tmpName) {
    for (int attempt = 0; attempt < 16; ++attempt) {
        tmpName = fmt::format(".extension.key.{:08x}", randombytes_random());
        Descriptor fd(::openat(dirfd, tmpName.c_str(),
                               O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
        if (!fd.valid() && errno == EEXIST) {
            continue;
        }
        if (!fd.valid()) {
            return errno;
        }
        const ssize_t n = ::write(fd.get(), key.data(), key.size());
        int err = n == static_cast<ssize_t>(key.size()) ? 0 : (n < 0 ? errno : EIO);
        if (const int closed = fd.close(); !err) {
            err = closed;
        }
        if (err) {
            ::unlinkat(dirfd, tmpName.c_str(), 0);
        }
        return err;
    }
    return EEXIST;
}

Error keyError(int err, const std::filesystem::path& file) {
    return QRN_POSIX_ERROR(err, "Failed to set up the extension key {}: {}", file.string(),
                           std::strerror(err));
}

} // namespace

LinuxSandboxExtensions::LinuxSandboxExtensions(const Paths& paths)
    : keyFile_(paths.runDirectory() / kKeyFileName) {
    static const int sodiumReady = sodium_init();
    if (sodiumReady < 0) {
        QRN_LOG_FAULT(LogCategory::Sandbox, "Failed to initialise libsodium");
    }
}

Result<Key> LinuxSandboxExtensions::key() {
    std::lock_guard guard(mutex_);
    if (!key_) {
        auto loaded = loadOrCreateKey();
        if (!loaded) {
            return loaded;
        }
        key_ = *loaded;
    }
    return *key_;
}

Result<Key> LinuxSandboxExtensions::loadOrCreateKey() const {
    std::error_code ec;
    std::filesystem::create_directories(keyFile_.parent_path(), ec);
    Descriptor dirfd(::open(keyFile_.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!dirfd.valid()) {
        return QRN_UNEXPECTED(keyError(errno, keyFile_));
    }
    const KeyFileRead read = readKeyFile(dirfd.get(), kKeyFileName);
    switch (read.state) {
    case KeyFileRead::State::Usable:
        return read.key;
    case KeyFileRead::State::Failed:
        return QRN_UNEXPECTED(keyError(read.error, keyFile_));
    case KeyFileRead::State::Absent:
        return publishNewKey(false);
    case KeyFileRead::State::Unusable:
        QRN_LOG_ERROR(LogCategory::Sandbox, "Replacing unusable extension key {}",
                      keyFile_.string());
        return publishNewKey(true);
    }
    return QRN_UNEXPECTED(keyError(EINVAL, keyFile_));
}

// The key file appears complete or not at all: the key is written to a
// temporary file first, which is then linked in (exclusive, like O_EXCL:
// when another daemon won the race its key is read back and used) or, to
// replace an unusable file, renamed over it.
Result<Key> LinuxSandboxExtensions::publishNewKey(bool replace) const {
    Descriptor dirfd(::open(keyFile_.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!dirfd.valid()) {
        return QRN_UNEXPECTED(keyError(errno, keyFile_));
    }
    Key key;
    randombytes_buf(key.data(), key.size());
    std::string tmpName;
    if (const int err = writeTemporaryKey(dirfd.get(), key, tmpName)) {
        return QRN_UNEXPECTED(keyError(err, keyFile_));
    }
    const int rc = replace ? ::renameat(dirfd.get(), tmpName.c_str(), dirfd.get(), kKeyFileName)
                           : ::linkat(dirfd.get(), tmpName.c_str(), dirfd.get(), kKeyFileName, 0);
    const int err = rc == 0 ? 0 : errno;
    ::unlinkat(dirfd.get(), tmpName.c_str(), 0);
    if (err == EEXIST) {
        const KeyFileRead winner = readKeyFile(dirfd.get(), kKeyFileName);
        if (winner.state == KeyFileRead::State::Usable) {
            return winner.key;
        }
        return publishNewKey(true);
    }
    if (err) {
        return QRN_UNEXPECTED(keyError(err, keyFile_));
    }
    return key;
}

Result<std::string> LinuxSandboxExtensions::issueFileExtension(std::string_view extensionClass,
                                                               std::string_view path,
                                                               const IpcPeer::AuditToken& token) {
    const IpcPeer::TokenFields fields = IpcPeer::fieldsOfAuditToken(token);
    if (path.empty() || fields.pid == 0) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(EINVAL, "No extension for path \"{}\" to pid {}", path, fields.pid));
    }
    auto signingKey = key();
    if (!signingKey) {
        return QRN_UNEXPECTED(signingKey.error());
    }
    auto made = SandboxExtensionToken::make(*signingKey, extensionClass, path, fields.pid,
                                            fields.startTime);
    if (!made) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(
            EINVAL, "No extension of class \"{}\" for path \"{}\"", extensionClass, path));
    }
    return *made;
}

} // namespace quarn
