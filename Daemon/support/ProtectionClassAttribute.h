#pragma once
// The data protection class of a file or directory, kept in an extended
// attribute as decimal text: "trusted.quarn.protection_class" when the
// process runs as root, "user.quarn.protection_class" otherwise (the trusted
// namespace needs privilege). Read and set through an open descriptor (not
// O_PATH: the kernel refuses attributes on those), so callers that walk trees
// by descriptor never follow a link here.
//
// Failures report the errno: EBADF for items that cannot hold a class (links,
// sockets, devices, fifos) and for O_PATH descriptors; EINVAL for a stored
// value that is not a class number; whatever the kernel reports otherwise.

#include "Daemon/support/Expected.h"

namespace quarn {

class ProtectionClassAttribute {
public:
    // An absent attribute: no class has been set on the item.
    static constexpr int kNoClass = 0;
    // The lowest class: readable whatever the device's lock state.
    static constexpr int kLowestClass = 4;

    static const char* attributeName();

    // kNoClass when the item carries no attribute (ENODATA is not an error).
    static Expected<int, int> getProtectionClass(int fd);
    // `protectionClass` must not be negative (EINVAL).
    static Expected<void, int> setProtectionClass(int fd, int protectionClass);
};

} // namespace quarn
