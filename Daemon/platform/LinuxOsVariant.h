#pragma once
// OsVariant from the root's os-release file (etc/os-release, else
// usr/lib/os-release): VARIANT_ID "internal" marks an internal build;
// BUILD_ID, VERSION_ID and VARIANT_ID make the version dictionary.

#include "Daemon/platform/OsVariant.h"
#include "Daemon/platform/Paths.h"

#include <functional>
#include <map>

namespace quarn {

class LinuxOsVariant final : public OsVariant {
public:
    using Fields = std::map<std::string, std::string, std::less<>>;

    explicit LinuxOsVariant(Paths paths);

    bool hasInternalContent(std::string_view subsystem) const override;
    Value versionDictionary() const override;
    std::optional<std::string> buildVersion() const override;

    // The assignments of an os-release file. Values may be quoted with " (in
    // which \" \\ \$ \` are escapes) or ' (taken literally); unquoted values
    // take a backslash as escaping the next character. Comments, blank lines
    // and lines that are not a well-formed assignment are skipped; a later
    // assignment of a key wins.
    static Fields parseOsRelease(std::string_view contents);

private:
    Fields readFields() const;

    Paths paths_;
};

} // namespace quarn
