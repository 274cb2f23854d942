#include "Daemon/platform/ConfigFile.h"

#include "Daemon/support/Descriptor.h"
#include <cerrno>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace quarn {

namespace {

// Reads to the end or one byte past `maxBytes`, whichever comes first.
Expected<std::string, int> readAll(int fd, std::size_t maxBytes) {
    std::string contents;
    char chunk[4096];
    for (;;) {
        const ssize_t n = ::read(fd, chunk, sizeof chunk);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return Unexpected<int>(errno);
        }
        if (n == 0) {
            return contents;
        }
        contents.append(chunk, static_cast<std::size_t>(n));
        if (contents.size() > maxBytes) {
            return Unexpected<int>(EFBIG);
        }
    }
}

} // namespace

Expected<std::string, int> ConfigFile::read(const std::filesystem::path& path, Links links,
                                            std::size_t maxBytes) {
    // O_NONBLOCK: a FIFO planted at the path must not hang the caller.
    int flags = O_RDONLY | O_CLOEXEC | O_NONBLOCK;
    if (links == Links::Refuse) {
        flags |= O_NOFOLLOW;
    }
    int fd;
    do {
        fd = ::open(path.c_str(), flags);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        return Unexpected<int>(errno == ELOOP ? EINVAL : errno);
    }
    const Descriptor file(fd);
    struct stat st {};
    if (::fstat(file.get(), &st) != 0) {
        return Unexpected<int>(errno);
    }
    if (!S_ISREG(st.st_mode)) {
        return Unexpected<int>(EINVAL);
    }
    return readAll(file.get(), maxBytes);
}

bool ConfigFile::isBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\n' || c == '\v' || c == '\f';
}

std::string_view ConfigFile::trimmed(std::string_view text) {
    while (!text.empty() && isBlank(text.front())) {
        text.remove_prefix(1);
    }
    while (!text.empty() && isBlank(text.back())) {
        text.remove_suffix(1);
    }
    return text;
}

} // namespace quarn
