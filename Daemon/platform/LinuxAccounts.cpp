#include "Daemon/platform/LinuxAccounts.h"

#include "Daemon/support/Log.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <grp.h>
#include <memory>
#include <pwd.h>
#include <vector>

namespace quarn {

namespace {

constexpr std::size_t kInitialBufferBytes = 1024;

// Entries that the C library parses but that name nobody: an empty name, or
// the "+"/"-" markers of the old compat syntax.
bool isRealName(const char* name) {
    return name && name[0] != '\0' && name[0] != '+' && name[0] != '-';
}

// A name worth asking about: a name with a NUL in it would be cut short and
// match another entry.
bool isQueryableName(std::string_view name) {
    return !name.empty() && name.find('\0') == std::string_view::npos;
}

// "Not found" as the various name service modules spell it.
bool isNotFound(int err) {
    return err == 0 || err == ENOENT || err == ESRCH || err == EBADF || err == EPERM;
}

// Runs `lookup(buffer, size)` until it stops asking for a bigger buffer.
template <class Lookup> int withGrowingBuffer(Lookup&& lookup) {
    std::vector<char> buffer(kInitialBufferBytes);
    for (;;) {
        const int err = lookup(buffer.data(), buffer.size());
        if (err != ERANGE || buffer.size() >= LinuxAccounts::kMaxEntryBytes) {
            return err;
        }
        buffer.resize(buffer.size() * 2);
    }
}

using File = std::unique_ptr<FILE, int (*)(FILE*)>;

File openDatabase(const std::filesystem::path& path) {
    File file(std::fopen(path.c_str(), "re"), &std::fclose);
    if (!file && errno != ENOENT) {
        const int err = errno;
        QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to open {}: {}", path.string(),
                      std::strerror(err));
    }
    return file;
}

// Walks the entries of an open database file with `next` (fgetpwent_r or
// fgetgrent_r), growing the buffer when an entry does not fit. Lines the C
// library cannot parse are skipped by it; `visit` returns true to stop.
template <class Entry, class Next, class Visit>
void forEachEntry(FILE* file, Next next, Visit&& visit) {
    std::vector<char> buffer(kInitialBufferBytes);
    for (;;) {
        Entry entry{};
        Entry* result = nullptr;
        const int err = next(file, &entry, buffer.data(), buffer.size(), &result);
        if (err == ERANGE && buffer.size() < LinuxAccounts::kMaxEntryBytes) {
            buffer.resize(buffer.size() * 2); // the C library rewinds to the entry's start
            continue;
        }
        if (err != 0 || !result) {
            if (err != 0 && err != ENOENT) {
                QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to read account entry: {}",
                              std::strerror(err));
            }
            return;
        }
        if (visit(entry)) {
            return;
        }
    }
}

} // namespace

LinuxAccounts::LinuxAccounts(Paths paths) : paths_(std::move(paths)) {}

std::optional<Accounts::User> LinuxAccounts::userByName(std::string_view name) const {
    if (!isQueryableName(name)) {
        return std::nullopt;
    }
    const std::string key(name);
    if (paths_.isSystemRoot()) {
        return systemUser(&key, 0);
    }
    return fileUser([&](const passwd& pw) { return key == pw.pw_name; });
}

std::optional<Accounts::User> LinuxAccounts::userByUID(std::uint32_t uid) const {
    if (paths_.isSystemRoot()) {
        return systemUser(nullptr, uid);
    }
    return fileUser([&](const passwd& pw) { return pw.pw_uid == uid; });
}

std::optional<Accounts::Group> LinuxAccounts::groupByName(std::string_view name) const {
    if (!isQueryableName(name)) {
        return std::nullopt;
    }
    const std::string key(name);
    if (paths_.isSystemRoot()) {
        return systemGroup(&key, 0);
    }
    return fileGroup([&](const group& gr) { return key == gr.gr_name; });
}

std::optional<Accounts::Group> LinuxAccounts::groupByGID(std::uint32_t gid) const {
    if (paths_.isSystemRoot()) {
        return systemGroup(nullptr, gid);
    }
    return fileGroup([&](const group& gr) { return gr.gr_gid == gid; });
}

std::optional<Accounts::User> LinuxAccounts::systemUser(const std::string* name,
                                                        std::uint32_t uid) const {
    std::optional<User> found;
    const int err = withGrowingBuffer([&](char* buffer, std::size_t size) {
        passwd entry{};
        passwd* result = nullptr;
        const int rc = name ? getpwnam_r(name->c_str(), &entry, buffer, size, &result)
                            : getpwuid_r(uid, &entry, buffer, size, &result);
        if (rc == 0 && result && isRealName(entry.pw_name)) {
            found = makeUser(entry);
        }
        return rc;
    });
    if (!isNotFound(err)) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to look up user {}: {}",
                      name ? *name : std::to_string(uid), std::strerror(err));
    }
    return found;
}

std::optional<Accounts::Group> LinuxAccounts::systemGroup(const std::string* name,
                                                          std::uint32_t gid) const {
    std::optional<Group> found;
    const int err = withGrowingBuffer([&](char* buffer, std::size_t size) {
        group entry{};
        group* result = nullptr;
        const int rc = name ? getgrnam_r(name->c_str(), &entry, buffer, size, &result)
                            : getgrgid_r(gid, &entry, buffer, size, &result);
        if (rc == 0 && result && isRealName(entry.gr_name)) {
            found = makeGroup(entry);
        }
        return rc;
    });
    if (!isNotFound(err)) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to look up group {}: {}",
                      name ? *name : std::to_string(gid), std::strerror(err));
    }
    return found;
}

std::optional<Accounts::User> LinuxAccounts::fileUser(const UserMatch& matches) const {
    File file = openDatabase(paths_.resolve("/etc/passwd"));
    if (!file) {
        return std::nullopt;
    }
    std::optional<User> found;
    forEachEntry<passwd>(file.get(), &fgetpwent_r, [&](const passwd& entry) {
        if (isRealName(entry.pw_name) && matches(entry)) {
            found = makeUser(entry);
        }
        return found.has_value();
    });
    return found;
}

std::optional<Accounts::Group> LinuxAccounts::fileGroup(const GroupMatch& matches) const {
    File file = openDatabase(paths_.resolve("/etc/group"));
    if (!file) {
        return std::nullopt;
    }
    std::optional<Group> found;
    forEachEntry<group>(file.get(), &fgetgrent_r, [&](const group& entry) {
        if (isRealName(entry.gr_name) && matches(entry)) {
            found = makeGroup(entry);
        }
        return found.has_value();
    });
    return found;
}

Accounts::User LinuxAccounts::makeUser(const passwd& entry) const {
    User user;
    user.name = entry.pw_name;
    user.uid = entry.pw_uid;
    user.gid = entry.pw_gid;
    user.homeDirectory = homeBelowRoot(entry.pw_dir);
    return user;
}

Accounts::Group LinuxAccounts::makeGroup(const group& entry) {
    Group result;
    result.name = entry.gr_name;
    result.gid = entry.gr_gid;
    for (char** member = entry.gr_mem; member && *member; ++member) {
        if (**member != '\0') {
            result.members.emplace_back(*member);
        }
    }
    return result;
}

std::filesystem::path LinuxAccounts::homeBelowRoot(const char* home) const {
    if (!home || home[0] == '\0') {
        return {};
    }
    if (paths_.isSystemRoot()) {
        return home;
    }
    // A ".." would lead out of the root prefix: such a home is no home.
    for (const auto& component : std::filesystem::path(home)) {
        if (component == "..") {
            QRN_LOG_ERROR(LogCategory::Unspecified,
                          "Ignoring home directory {} that leads out of the root", home);
            return {};
        }
    }
    return paths_.resolve(home);
}

} // namespace quarn
