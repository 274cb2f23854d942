#include "Daemon/platform/ExecutableDigestCache.h"

#include <sodium.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

namespace quarn {

std::optional<ExecutableDigestCache::Key> ExecutableDigestCache::keyOf(int fd) {
    struct stat st {};
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        return std::nullopt;
    }
    return Key{st.st_dev,          st.st_ino,         st.st_size,        st.st_mtim.tv_sec,
               st.st_mtim.tv_nsec, st.st_ctim.tv_sec, st.st_ctim.tv_nsec};
}

std::optional<ExecutableDigestCache::Digest> ExecutableDigestCache::hash(int fd) {
    crypto_hash_sha256_state state;
    crypto_hash_sha256_init(&state);
    std::vector<unsigned char> buffer(1 << 16);
    for (off_t offset = 0;;) {
        const ssize_t n = ::pread(fd, buffer.data(), buffer.size(), offset);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return std::nullopt;
        }
        if (n == 0) {
            break;
        }
        crypto_hash_sha256_update(&state, buffer.data(), static_cast<std::size_t>(n));
        offset += n;
    }
    Digest digest;
    crypto_hash_sha256_final(&state, digest.data());
    return digest;
}

std::optional<ExecutableDigestCache::Digest> ExecutableDigestCache::digestOf(int fd) {
    const std::optional<Key> before = keyOf(fd);
    if (!before) {
        return std::nullopt;
    }
    {
        std::lock_guard guard(mutex_);
        if (auto it = entries_.find(*before); it != entries_.end()) {
            return it->second;
        }
    }
    const std::optional<Digest> digest = hash(fd);
    // Written to while read: the digest is of no version of the file.
    if (!digest || keyOf(fd) != before) {
        return std::nullopt;
    }
    std::lock_guard guard(mutex_);
    if (entries_.size() >= kMaxEntries) {
        entries_.clear();
    }
    entries_.emplace(*before, *digest);
    return digest;
}

} // namespace quarn
