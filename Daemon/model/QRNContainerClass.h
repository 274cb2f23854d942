#pragma once
// The container class table: where each class lives on disk, its short name,
// and the predicates that decide ownership, user identities and staging.
// Every predicate is a pure function of the number; numbers outside 1..13
// get the answers the sets below give them (callers reject them separately).

#include <cstdint>
#include <string_view>

namespace quarn {

enum QRNContainerClassNumber : std::uint64_t {
    kQRNContainerClassUndefined = 0,
    kQRNContainerClassAppBundle = 1,
    kQRNContainerClassAppData = 2,
    kQRNContainerClassPluginBundle = 3,
    kQRNContainerClassPluginData = 4,
    kQRNContainerClassVPNBundle = 5,
    kQRNContainerClassVPNData = 6,
    kQRNContainerClassAppGroup = 7,
    kQRNContainerClassFramework = 8,
    kQRNContainerClassVellService = 9,
    kQRNContainerClassInternalDaemon = 10,
    kQRNContainerClassTempDir = 11,
    kQRNContainerClassSystemData = 12,
    kQRNContainerClassSystemGroup = 13,
    kQRNContainerClassMax = 14,
};

class QRNContainerClass {
public:
    // Which directory a global class's transient containers live under.
    enum class TransientBase { None, TransientBundle, Transient };

    static constexpr std::uint32_t kBaseDirectoryMode = 0755;

    // 1..13.
    static bool isValid(std::uint64_t cls) { return cls - 1 < 13; }

    // Two path components, e.g. "Data/Application"; "Undefined" for 0, "MAX"
    // for 14 and empty beyond the table.
    static std::string_view relativeDirectory(std::uint64_t cls);
    // "appData" and so on; empty for 0, 14 and beyond.
    static std::string_view shortName(std::uint64_t cls);

    // {1, 3, 5, 8}
    static bool isBundle(std::uint64_t cls);
    // {12, 13}
    static bool isSystem(std::uint64_t cls);
    // Bundle or system: containers not kept per user.
    static bool isGlobal(std::uint64_t cls) { return isBundle(cls) || isSystem(cls); }
    // A valid class that is not global: {2, 4, 6, 7, 9, 10, 11}.
    static bool isPerUser(std::uint64_t cls) { return isValid(cls) && !isGlobal(cls); }
    // Not bundle and not system; true for 0 and numbers above 13 as well.
    static bool isUserIdentityRequired(std::uint64_t cls);
    // {7, 13}
    static bool isGroup(std::uint64_t cls);
    // {2, 4, 6, 7, 9, 10, 11}: creation staged in the user's staging directory.
    static bool usesPerUserStaging(std::uint64_t cls);

    static TransientBase transientBase(std::uint64_t cls);
    // Owner of a global class's base directory: the installation uid for
    // bundle classes, root otherwise.
    static std::uint32_t baseDirectoryOwner(std::uint64_t cls);
};

} // namespace quarn
