#pragma once
// One directory of the layout: its URL is computed on first use and kept,
// and, when asked, the directory is created then (mode 0755, intermediate
// directories). A failed creation is logged and the URL still handed out:
// callers find the problem when they use the path. Thread-safe.

#include <sys/types.h>

#include <filesystem>
#include <functional>
#include <mutex>
#include <string_view>

namespace quarn {

class QRNFileManager;

class QRNLazyDirectory {
public:
    static constexpr mode_t kMode = 0755;

    struct Creation {
        // Completes "Failed to create <what> at ...", e.g. "staging dir".
        std::string_view what;
        uid_t owner = 0; // 0: leave the owner alone
        int protectionClass = -1;
    };

    // The URL, computed (and created, when `creation` is given) once.
    const std::filesystem::path& url(const std::function<std::filesystem::path()>& compute,
                                     QRNFileManager& fileManager, const Creation* creation);

    // Creates `url` and logs a failure as "Failed to create <what> at "<url>": <error>".
    static void create(QRNFileManager& fileManager, const std::filesystem::path& url,
                       const Creation& creation);

private:
    std::once_flag once_;
    std::filesystem::path url_; // written once under once_
};

} // namespace quarn
