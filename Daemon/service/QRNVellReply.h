#pragma once
// The reply of one request: a dictionary tied to the connection the request
// came on. Copies share the connection, so a handler that finishes later
// (commands 4 and 21) keeps a copy and sends it from its completion. Copies
// also share whether the reply went out: a request gets one reply at most,
// also when the dispatcher reports a failure after such a handler returned.

#include "Daemon/platform/IpcConnection.h"
#include "Daemon/support/Value.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

namespace quarn {

class QRNVellReply {
public:
    static constexpr const char* kErrorKey = "ReplyError";

    explicit QRNVellReply(std::shared_ptr<IpcConnection> remote);

    void set(std::string key, Value value) { dictionary_.set(std::move(key), std::move(value)); }
    const Value& dictionary() const { return dictionary_; }

    // Writes "ReplyError" (1 on success) and sends the dictionary, unless
    // this reply or a copy of it was sent already.
    void sendWithError(std::uint64_t error);

private:
    std::shared_ptr<IpcConnection> remote_;
    std::shared_ptr<std::atomic<bool>> sent_;
    Value dictionary_;
};

} // namespace quarn
