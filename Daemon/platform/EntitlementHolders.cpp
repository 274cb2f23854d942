#include "Daemon/platform/EntitlementHolders.h"

#include <fmt/format.h>

#include <algorithm>
#include <limits>

namespace quarn {

namespace {

bool readPrincipals(const Value& plist, std::string_view key,
                    std::vector<EntitlementHolders::Principal>& out, std::string& problem) {
    const Value* value = plist.get(key);
    if (!value) {
        return true;
    }
    const Value::Array* array = value->asArray();
    if (!array) {
        problem = fmt::format("\"{}\" is not an array", key);
        return false;
    }
    for (const Value& item : *array) {
        if (const std::string* name = item.asString(); name && !name->empty()) {
            out.emplace_back(*name);
        } else if (const auto number = item.asUInt64();
                   number && *number <= std::numeric_limits<std::uint32_t>::max()) {
            out.emplace_back(static_cast<std::uint32_t>(*number));
        } else {
            problem = fmt::format("\"{}\" holds {}, not a name or an id", key, item.description());
            return false;
        }
    }
    return true;
}

} // namespace

std::optional<EntitlementHolders> EntitlementHolders::fromPropertyList(const Value& plist,
                                                                       std::string& problem) {
    EntitlementHolders holders;
    if (!readPrincipals(plist, "EntitledUsers", holders.users_, problem) ||
        !readPrincipals(plist, "EntitledGroups", holders.groups_, problem)) {
        return std::nullopt;
    }
    holders.named_ = plist.get("EntitledUsers") || plist.get("EntitledGroups");
    return holders;
}

bool EntitlementHolders::admitsUser(std::uint32_t uid, const Accounts& accounts) const {
    if (!named_) {
        return uid == 0;
    }
    return std::any_of(users_.begin(), users_.end(), [&](const Principal& principal) {
        if (const auto* id = std::get_if<std::uint32_t>(&principal)) {
            return *id == uid;
        }
        const auto user = accounts.userByName(std::get<std::string>(principal));
        return user && user->uid == uid;
    });
}

bool EntitlementHolders::admitsGroup(std::uint32_t gid, const Accounts& accounts) const {
    return std::any_of(groups_.begin(), groups_.end(), [&](const Principal& principal) {
        if (const auto* id = std::get_if<std::uint32_t>(&principal)) {
            return *id == gid;
        }
        const auto group = accounts.groupByName(std::get<std::string>(principal));
        return group && group->gid == gid;
    });
}

std::optional<std::string> EntitlementHolders::refusal(const Process& process,
                                                       const Accounts& accounts) const {
    const ProcessInfo::Standing& standing = process.standing;
    // Whoever traces a process or chose its preloaded code runs code as it.
    if (standing.tracer != 0) {
        return fmt::format("it is traced by pid {}", standing.tracer);
    }
    if (!process.loaderInjection.empty()) {
        return fmt::format("it was started with {}", process.loaderInjection);
    }
    if (admitsUser(standing.effectiveUID, accounts) ||
        admitsGroup(standing.effectiveGID, accounts) ||
        std::any_of(standing.groups.begin(), standing.groups.end(),
                    [&](std::uint32_t gid) { return admitsGroup(gid, accounts); })) {
        return std::nullopt;
    }
    return named_ ? fmt::format("uid {} is not among the entry's entitled users and groups",
                                standing.effectiveUID)
                  : fmt::format("uid {} is not root, and the entry names no entitled users",
                                standing.effectiveUID);
}

} // namespace quarn
