#include "Client/ClientError.h"

#include <fmt/format.h>

namespace quarn {

ClientError ClientError::fromCode(std::uint64_t code) {
    return ClientError{Kind::Daemon, code, QRNErrorCodeName(code), {}};
}

ClientError ClientError::transport(const Error& error) {
    return ClientError{Kind::Transport, 0, "NoReply", error.message};
}

ClientError ClientError::badReply(std::string message) {
    return ClientError{Kind::BadReply, 0, "BadReply", std::move(message)};
}

std::string ClientError::description() const {
    switch (kind) {
    case Kind::Daemon:
        return fmt::format("error {} ({})", code, name);
    case Kind::Transport:
        return fmt::format("no reply: {}", message);
    case Kind::BadReply:
        break;
    }
    return fmt::format("bad reply: {}", message);
}

} // namespace quarn
