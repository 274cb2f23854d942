#include "Daemon/platform/FirstBootMarker.h"

#include "Daemon/platform/Paths.h"
#include "Daemon/support/Log.h"

#include <fcntl.h>
#include <semaphore.h>
#include <sodium.h>

#include <cerrno>
#include <cstring>

namespace quarn {

namespace {

// The first 8 hex digits of the SHA-256 of the (normalised) root prefix.
std::string rootHash(const std::string& root) {
    // The library wants this before any other call; repeating it is harmless.
    [[maybe_unused]] static const int sodiumReady = sodium_init();
    unsigned char digest[crypto_hash_sha256_BYTES];
    crypto_hash_sha256(digest, reinterpret_cast<const unsigned char*>(root.data()), root.size());
    char hex[2 * 4 + 1];
    sodium_bin2hex(hex, sizeof hex, digest, 4);
    return hex;
}

} // namespace

FirstBootMarker::FirstBootMarker(const std::filesystem::path& rootPrefix) {
    const Paths paths(rootPrefix);
    name_ = std::string("/") + kBaseName;
    if (!paths.isSystemRoot()) {
        // Appended in two steps: gcc 12 warns (wrongly) about "." + a temporary.
        name_ += '.';
        name_ += rootHash(paths.rootPrefix().string());
    }
}

bool FirstBootMarker::exists() const {
    sem_t* semaphore = ::sem_open(name_.c_str(), 0);
    if (semaphore == SEM_FAILED) {
        const int err = errno;
        // EACCES: there, but not ours to open; it still marks the first boot done.
        if (err != ENOENT && err != EACCES) {
            QRN_LOG_ERROR(LogCategory::Startup, "Failed to open semaphore {}: {}", name_,
                          std::strerror(err));
        }
        return err == EACCES;
    }
    ::sem_close(semaphore);
    return true;
}

Status FirstBootMarker::create() const {
    sem_t* semaphore = ::sem_open(name_.c_str(), O_CREAT, 0444, 0);
    if (semaphore == SEM_FAILED) {
        const int err = errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "sem_open {} failed: {}", name_, std::strerror(err)));
    }
    ::sem_close(semaphore);
    return {};
}

Status FirstBootMarker::remove() const {
    if (::sem_unlink(name_.c_str()) != 0 && errno != ENOENT) {
        const int err = errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "sem_unlink {} failed: {}", name_, std::strerror(err)));
    }
    return {};
}

} // namespace quarn
