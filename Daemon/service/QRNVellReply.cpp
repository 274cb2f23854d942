#include "Daemon/service/QRNVellReply.h"

namespace quarn {

QRNVellReply::QRNVellReply(std::shared_ptr<IpcConnection> remote)
    : remote_(std::move(remote)), sent_(std::make_shared<std::atomic<bool>>(false)),
      dictionary_(Value::dictionary()) {}

void QRNVellReply::sendWithError(std::uint64_t error) {
    if (sent_->exchange(true)) {
        return;
    }
    dictionary_.set(kErrorKey, Value(error));
    if (remote_) {
        remote_->sendReply(dictionary_);
    }
}

} // namespace quarn
