#include "Daemon/model/QRNLazyDirectory.h"

#include "Daemon/fs/QRNFileManager.h"

namespace quarn {

const std::filesystem::path&
QRNLazyDirectory::url(const std::function<std::filesystem::path()>& compute,
                      QRNFileManager& fileManager, const Creation* creation) {
    std::call_once(once_, [&] {
        url_ = compute();
        if (creation) {
            create(fileManager, url_, *creation);
        }
    });
    return url_;
}

void QRNLazyDirectory::create(QRNFileManager& fileManager, const std::filesystem::path& url,
                              const Creation& creation) {
    auto made = fileManager.createDirectoryAtURL(url, true, kMode, creation.owner,
                                                 creation.protectionClass);
    if (!made) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to create {} at \"{}\": {}", creation.what,
                      url.string(), made.error().description());
    }
}

} // namespace quarn
