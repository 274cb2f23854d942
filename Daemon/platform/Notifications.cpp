#include "Daemon/platform/Notifications.h"

#include <algorithm>

namespace quarn {

bool Notifications::isValidName(std::string_view name) {
    if (name.empty() || name.size() > kMaxNameLength || name.front() == '.') {
        return false;
    }
    return std::all_of(name.begin(), name.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
               c == '.' || c == '-' || c == '_';
    });
}

} // namespace quarn
