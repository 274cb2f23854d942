#include "Daemon/QRNVellReply.h"

namespace quarn {

QRNVellReply::QRNVellReply(std::shared_ptr<IpcConnection> remote)
    : remote_(std::move(remote)), dictionary_(Value::dictionary()) {}

void QRNVellReply::sendWithError(std::uint64_t error) {
    dictionary_.set(kErrorKey, Value(error));
    if (remote_) {
        remote_->sendReply(dictionary_);
    }
}

} // namespace quarn
