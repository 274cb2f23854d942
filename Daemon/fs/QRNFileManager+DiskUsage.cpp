// Disk usage of a tree: the allocated size of everything in it.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/Features.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Signpost.h"

#include <fmt/format.h>

#include <cerrno>
#include <cstring>
#include <set>
#include <utility>

namespace quarn {

namespace {

namespace fs = std::filesystem;
using Entry = QRNFileManager::TraversalEntry;

constexpr const char* kFeatureDomain = "quarnd";
constexpr const char* kFastSizingFeature = "fast_container_sizing";
constexpr const char* kSignpostName = "CalculatingDiskUsage";

struct DirectoryStatistics {
    std::uint64_t descendants = 0;
    std::int64_t totalSize = 0;
};

// File systems that keep directory statistics answer a tree's size at once.
// Linux has none, so the question is answered as such a file system answers
// for a directory that does not keep them, and enabling them fails alike.
SysResult<DirectoryStatistics> fastDirectoryStatistics(const fs::path&) {
    return SysError(ENOTSUP);
}

SysStatus enableDirectoryStatistics(const fs::path&) {
    return SysError(ENOTSUP);
}

// Sums st_blocks * 512 over one file system, each inode once (hard links).
class TreeSize {
public:
    void add(const Entry& entry) {
        if (entry.kind == Entry::Kind::DirectoryPostOrder) {
            return;
        }
        if (entry.level == 0) {
            device_ = entry.status.st_dev;
        } else if (entry.status.st_dev != device_) {
            return; // a mount point: its contents are not walked either
        } else {
            ++descendants_;
        }
        if (!S_ISDIR(entry.status.st_mode) && entry.status.st_nlink > 1 &&
            !seen_.emplace(entry.status.st_dev, entry.status.st_ino).second) {
            return;
        }
        const auto bytes = static_cast<std::int64_t>(entry.status.st_blocks) * 512;
        overflowed_ = overflowed_ || __builtin_add_overflow(total_, bytes, &total_);
    }

    std::uint64_t descendants() const { return descendants_; }
    // Negative when the sum does not fit.
    std::int64_t total() const { return overflowed_ ? -1 : total_; }

private:
    dev_t device_ = 0;
    std::uint64_t descendants_ = 0;
    std::int64_t total_ = 0;
    bool overflowed_ = false;
    std::set<std::pair<dev_t, ino_t>> seen_;
};

int errnoOf(const Error& error) {
    return error.domain == Error::Domain::POSIX ? static_cast<int>(error.code) : EIO;
}

} // namespace

std::int64_t QRNFileManager::fastDiskUsageForURL(const fs::path& url) {
    if (!context_->instance<Features>().isEnabled(kFeatureDomain, kFastSizingFeature)) {
        return diskUsageForURL(url);
    }
    if (url.empty()) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to get path to url {}", url.string());
        return -1;
    }
    const std::string path = url.string();
    Signpost signpost(LogCategory::Fs, kSignpostName, path);
    auto stats = fastDirectoryStatistics(url);
    if (!stats && stats.error() == ENOTSUP) {
        if (auto enabled = enableDirectoryStatistics(url); !enabled) {
            QRN_LOG_ERROR(LogCategory::Fs, "Failed to set maintain-dir-stats on {}: (err {}) {}",
                          path, enabled.error(), std::strerror(enabled.error()));
        } else {
            QRN_LOG_NOTICE(LogCategory::Fs, "Enabled fast directory sizing on [{}]", path);
        }
        stats = fastDirectoryStatistics(url);
    }
    if (!stats) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to get dirstats on {}: (err {}) {}", path,
                      stats.error(), std::strerror(stats.error()));
    } else if (stats->totalSize < 0) {
        QRN_LOG_ERROR(LogCategory::Fs, "Invalid size ({}) from dirstats on {}: (err {}) {}",
                      stats->totalSize, path, 0, std::strerror(0));
    } else {
        QRN_LOG_DEBUG(LogCategory::Fs, "[{}]: descendants: {}, total size: {}", path,
                      stats->descendants, stats->totalSize);
        signpost.end(fmt::format("nodes: {}, size: {}", stats->descendants, stats->totalSize));
        return stats->totalSize;
    }
    signpost.end("fell back to a walk");
    return diskUsageForURL(url);
}

std::int64_t QRNFileManager::diskUsageForURL(const fs::path& url) {
    if (url.empty()) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to get path to url {}", url.string());
        return -1;
    }
    const std::string path = url.string();
    Signpost signpost(LogCategory::Fs, kSignpostName, path);
    TreeSize size;
    auto walked = _traverseDirectory(url, [&](const Entry& entry) -> Status {
        size.add(entry);
        return {};
    });
    if (!walked) {
        const int err = errnoOf(walked.error());
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to get dirstats on {} using fallback: (err {}) {}",
                      path, err, std::strerror(err));
        signpost.end("failed");
        return -1;
    }
    if (size.total() < 0) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "Invalid size ({}) from dirstats on {} using fallback: (err {}) {}",
                      size.total(), path, EOVERFLOW, std::strerror(EOVERFLOW));
        signpost.end("failed");
        return -1;
    }
    QRN_LOG_DEBUG(LogCategory::Fs, "[{}]: descendants: {}, total size: {}, using fallback", path,
                  size.descendants(), size.total());
    signpost.end(fmt::format("nodes: {}, size: {}", size.descendants(), size.total()));
    return size.total();
}

} // namespace quarn
