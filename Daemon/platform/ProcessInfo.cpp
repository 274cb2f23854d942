#include "Daemon/platform/ProcessInfo.h"

#include <fmt/format.h>

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <limits>
#include <vector>

namespace quarn {

namespace {

// The kernel caps argument and environment strings together near a quarter
// of the stack limit; a larger environment is not read to its end.
constexpr std::size_t kMaxEnvironmentBytes = 4 * 1024 * 1024;
// Each makes the dynamic loader map code of the caller's choice into a
// program before its main runs.
constexpr std::string_view kLoaderVariables[] = {"LD_PRELOAD=", "LD_AUDIT=", "LD_LIBRARY_PATH="};
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

Expected<std::string, int> ProcessInfo::read(const char* name, std::size_t maxBytes) const {
    Descriptor file(::openat(directory_->get(), name, O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!file.valid()) {
        return Unexpected<int>(errno);
    }
    std::string contents;
    char chunk[4096];
    while (contents.size() < maxBytes) {
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

Expected<ProcessInfo::Standing, int> ProcessInfo::standing() const {
    auto status = read("status");
    if (!status) {
        return Unexpected<int>(status.error());
    }
    const auto parsed = parseStanding(*status);
    return parsed ? Expected<Standing, int>(*parsed) : Unexpected<int>(EPROTO);
}

Expected<std::string, int> ProcessInfo::loaderInjection() const {
    auto environ = read("environ", kMaxEnvironmentBytes + 1);
    if (!environ) {
        return Unexpected<int>(environ.error());
    }
    if (environ->size() > kMaxEnvironmentBytes) {
        return Unexpected<int>(EFBIG);
    }
    // During an execve the new executable shows before its environment is
    // in place: that process cannot be told clean, and is asked again later.
    if (environ->empty()) {
        return Unexpected<int>(EAGAIN);
    }
    return findLoaderInjection(*environ);
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

std::optional<ProcessInfo::Standing> ProcessInfo::parseStanding(std::string_view status) {
    const auto ids = parseIds(status);
    if (!ids) {
        return std::nullopt;
    }
    Standing standing;
    standing.effectiveUID = ids->effectiveUID;
    standing.effectiveGID = ids->effectiveGID;
    bool sawTracer = false;
    bool sawGroups = false;
    for (std::size_t at = 0; at < status.size();) {
        const auto end = std::min(status.find('\n', at), status.size());
        const auto line = status.substr(at, end - at);
        at = end + 1;
        if (line.starts_with("TracerPid:")) {
            const auto fields = splitWhitespace(line.substr(10));
            const auto tracer = fields.size() == 1 ? parseDecimal<pid_t>(fields[0]) : std::nullopt;
            if (!tracer) {
                return std::nullopt;
            }
            standing.tracer = *tracer;
            sawTracer = true;
        } else if (line.starts_with("Groups:")) {
            for (const auto field : splitWhitespace(line.substr(7))) {
                const auto gid = parseDecimal<std::uint32_t>(field);
                if (!gid) {
                    return std::nullopt;
                }
                standing.groups.push_back(*gid);
            }
            sawGroups = true;
        }
    }
    // Without either line nothing tells whether the process may be trusted.
    return sawTracer && sawGroups ? std::optional<Standing>(std::move(standing)) : std::nullopt;
}

std::string ProcessInfo::findLoaderInjection(std::string_view environ) {
    for (std::size_t at = 0; at < environ.size();) {
        const auto end = std::min(environ.find('\0', at), environ.size());
        const auto variable = environ.substr(at, end - at);
        at = end + 1;
        for (const std::string_view name : kLoaderVariables) {
            // An empty value loads nothing.
            if (variable.starts_with(name) && variable.size() > name.size()) {
                return std::string(name.substr(0, name.size() - 1));
            }
        }
    }
    return {};
}

} // namespace quarn
