#pragma once
// SHA-256 digests of executables, remembered by the file's identity and
// change times so that a program is hashed once, not on every request.

#include <array>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <tuple>

namespace quarn {

class ExecutableDigestCache {
public:
    using Digest = std::array<std::uint8_t, 32>;
    // Beyond this many files the cache starts over; a device runs few programs.
    static constexpr std::size_t kMaxEntries = 512;

    // The digest of the regular file open at `fd` (read with pread, the
    // offset is left alone). None when it cannot be read, is no regular
    // file, or changed while it was being read.
    std::optional<Digest> digestOf(int fd);

private:
    // Device, inode, size, mtime and ctime (seconds, nanoseconds). ctime as
    // well as mtime: a file's owner can set mtime back, not ctime.
    using Key = std::tuple<std::uint64_t, std::uint64_t, std::int64_t, std::int64_t, std::int64_t,
                           std::int64_t, std::int64_t>;

    static std::optional<Key> keyOf(int fd);
    static std::optional<Digest> hash(int fd);

    // Guards entries_; never held while a file is read.
    std::mutex mutex_;
    std::map<Key, Digest> entries_;
};

} // namespace quarn
