#include "Daemon/fs/Env.h"

namespace quarn {

const char* envCallName(EnvCall call) {
    static constexpr const char* kNames[] = {
        "open",      "close",    "stat",     "mkdir",    "unlink",    "rename",
        "readlink",  "realpath", "symlink",  "mknod",    "chown",     "chmod",
        "getflags",  "setflags", "getxattr", "setxattr", "listxattr", "removexattr",
        "copyrange", "clone",    "read",     "write",    "opendir",   "readdir",
        "closedir",  "mkdtemp",  "utimens",  "aclget",   "aclset",    "openat2"};
    static_assert(std::size(kNames) == static_cast<std::size_t>(EnvCall::Count_));
    auto index = static_cast<std::size_t>(call);
    return index < std::size(kNames) ? kNames[index] : "unknown";
}

} // namespace quarn
