#include "Daemon/support/ProtectionClassAttribute.h"

#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <string>

namespace quarn {

namespace {

// Only regular files and directories hold a protection class.
int checkHolder(int fd) {
    struct stat st;
    if (fstat(fd, &st) != 0) {
        return errno;
    }
    return S_ISREG(st.st_mode) || S_ISDIR(st.st_mode) ? 0 : EBADF;
}

} // namespace

const char* ProtectionClassAttribute::attributeName() {
    return geteuid() == 0 ? "trusted.quarn.protection_class" : "user.quarn.protection_class";
}

Expected<int, int> ProtectionClassAttribute::getProtectionClass(int fd) {
    if (int err = checkHolder(fd)) {
        return Unexpected(err);
    }
    char text[16];
    ssize_t n = fgetxattr(fd, attributeName(), text, sizeof text);
    if (n < 0) {
        if (errno == ENODATA) {
            return kNoClass;
        }
        return Unexpected(errno == ERANGE ? EINVAL : errno);
    }
    int value = 0;
    auto [end, ec] = std::from_chars(text, text + n, value);
    if (n == 0 || ec != std::errc() || end != text + n || value < 0) {
        return Unexpected(EINVAL);
    }
    return value;
}

Expected<void, int> ProtectionClassAttribute::setProtectionClass(int fd, int protectionClass) {
    if (protectionClass < 0) {
        return Unexpected(EINVAL);
    }
    if (int err = checkHolder(fd)) {
        return Unexpected(err);
    }
    std::string text = std::to_string(protectionClass);
    if (fsetxattr(fd, attributeName(), text.data(), text.size(), 0) != 0) {
        return Unexpected(errno);
    }
    return {};
}

} // namespace quarn
