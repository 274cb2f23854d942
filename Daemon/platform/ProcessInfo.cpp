#include "Daemon/platform/ProcessInfo.h"

#include <fmt/format.h>

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <limits>
#include <vector>

namespace quarn {

namespace {

// "status" grows with the supplementary groups; the lines read here come first.
constexpr std::size_t kMaxFileBytes = 64 * 1024;
// Fields after the ')' that ends the command name start with field 3 (state).
constexpr std::size_t kStartTimeIndexAfterName = 22 - 3;

template <class T> std::optional<T> parseDecimal(std::string_view text) {
    T value{};
    const auto* end = text.data() + text.size();
    const auto [ptr, ec] = std::from_chars(text.data(), end, value);
    if (text.empty() || ec != std::errc() || ptr != end) {
        return std::nullopt;
    }
    return value;
}

// A plain scan: "stat" is split on every request, and find_first_of with a
// set costs a search of the set per character.
std::vector<std::string_view> splitWhitespace(std::string_view text) {
    const auto blank = [](char c) { return c == ' ' || c == '\t' || c == '\n'; };
    std::vector<std::string_view> fields;
    fields.reserve(64);
    std::size_t i = 0;
    while (i < text.size()) {
        while (i < text.size() && blank(text[i])) {
            ++i;
        }
        const std::size_t start = i;
        while (i < text.size() && !blank(text[i])) {
            ++i;
        }
        if (i > start) {
            fields.push_back(text.substr(start, i - start));
        }
    }
    return fields;
}

// The real and effective ids of a "Uid:" or "Gid:" line (real, effective,
// saved, file system).
std::optional<std::pair<std::uint32_t, std::uint32_t>> parseIdLine(std::string_view status,
                                                                   std::string_view label) {
    std::size_t at = 0;
    while (at < status.size()) {
        const auto end = std::min(status.find('\n', at), status.size());
        const auto line = status.substr(at, end - at);
        at = end + 1;
        if (!line.starts_with(label)) {
            continue;
        }
        const auto fields = splitWhitespace(line.substr(label.size()));
        if (fields.size() != 4) {
            return std::nullopt;
        }
        const auto real = parseDecimal<std::uint32_t>(fields[0]);
        const auto effective = parseDecimal<std::uint32_t>(fields[1]);
        if (!real || !effective) {
            return std::nullopt;
        }
        return std::pair{*real, *effective};
    }
    return std::nullopt;
}

} // namespace

Expected<ProcessInfo, int> ProcessInfo::open(pid_t pid) {
    if (pid <= 0) {
        return Unexpected<int>(EINVAL);
    }
    const std::string path = fmt::format("/proc/{}", pid);
    const int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        return Unexpected<int>(errno);
    }
    return ProcessInfo(std::make_shared<Descriptor>(fd));
}

Expected<std::string, int> ProcessInfo::read(const char* name) const {
    Descriptor file(::openat(directory_->get(), name, O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!file.valid()) {
        return Unexpected<int>(errno);
    }
    std::string contents;
    char chunk[4096];
    while (contents.size() < kMaxFileBytes) {
        const ssize_t n = ::read(file.get(), chunk, sizeof chunk);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return Unexpected<int>(errno);
        }
        if (n == 0) {
            break;
        }
        contents.append(chunk, static_cast<std::size_t>(n));
    }
    return contents;
}

Expected<std::uint64_t, int> ProcessInfo::startTime() const {
    auto stat = read("stat");
    if (!stat) {
        return Unexpected<int>(stat.error());
    }
    const auto parsed = parseStartTime(*stat);
    return parsed ? Expected<std::uint64_t, int>(*parsed) : Unexpected<int>(EPROTO);
}

Expected<ProcessInfo::Ids, int> ProcessInfo::ids() const {
    auto status = read("status");
    if (!status) {
        return Unexpected<int>(status.error());
    }
    const auto parsed = parseIds(*status);
    return parsed ? Expected<Ids, int>(*parsed) : Unexpected<int>(EPROTO);
}

Expected<std::uint32_t, int> ProcessInfo::loginUID() const {
    auto text = read("loginuid");
    if (!text) {
        // A kernel built without audit support keeps no login uid.
        return text.error() == ENOENT ? Expected<std::uint32_t, int>(kNoLoginUID)
                                      : Unexpected<int>(text.error());
    }
    const auto parsed = parseLoginUID(*text);
    return parsed ? Expected<std::uint32_t, int>(*parsed) : Unexpected<int>(EPROTO);
}

std::optional<std::uint64_t> ProcessInfo::parseStartTime(std::string_view stat) {
    // The command name may hold blanks and parentheses; it ends at the last ')'.
    const auto close = stat.rfind(')');
    if (close == std::string_view::npos || stat.find('(') > close) {
        return std::nullopt;
    }
    const auto fields = splitWhitespace(stat.substr(close + 1));
    if (fields.size() <= kStartTimeIndexAfterName) {
        return std::nullopt;
    }
    return parseDecimal<std::uint64_t>(fields[kStartTimeIndexAfterName]);
}

std::optional<ProcessInfo::Ids> ProcessInfo::parseIds(std::string_view status) {
    const auto uids = parseIdLine(status, "Uid:");
    const auto gids = parseIdLine(status, "Gid:");
    if (!uids || !gids) {
        return std::nullopt;
    }
    return Ids{uids->first, uids->second, gids->first, gids->second};
}

std::optional<std::uint32_t> ProcessInfo::parseLoginUID(std::string_view text) {
    if (text.ends_with('\n')) {
        text.remove_suffix(1);
    }
    return parseDecimal<std::uint32_t>(text);
}

} // namespace quarn
