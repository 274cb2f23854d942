#pragma once
// What the running system is: whether it is an internal build, and its
// version dictionary, whose build version decides whether an upgrade happened.

#include "Daemon/support/Value.h"

#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class OsVariant {
public:
    virtual ~OsVariant() = default;

    // Internal content is a property of the whole build: every subsystem
    // gets the same answer.
    virtual bool hasInternalContent(std::string_view subsystem) const = 0;
    // {"BuildID", "VersionID", "VariantID"}, each present only when known;
    // an empty dictionary when the system does not say.
    virtual Value versionDictionary() const = 0;
    // The "BuildID" of the version dictionary.
    virtual std::optional<std::string> buildVersion() const = 0;
};

} // namespace quarn
