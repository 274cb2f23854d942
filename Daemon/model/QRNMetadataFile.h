#pragma once
// Opens a container's metadata file only when the daemon can have written
// it: a regular file owned by root with one link and of a bounded size,
// reached without following a link at the file or at its container
// directory, and checked on the opened descriptor before a byte is read.
// Users own the directories holding these files and may plant anything
// there (a file of their own, a hard link to another container's file, a
// huge one); none of that may name a container.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/PathResolver.h"
#include "Daemon/support/PropertyList.h"
#include "Daemon/support/QRNError.h"

#include <cstddef>
#include <string>

namespace quarn {

class QRNMetadataFile {
public:
    static constexpr std::size_t kMaximumSize = 64 * 1024;

    // The file's dictionary; an error (logged) when it is not to be trusted,
    // unreadable or not a dictionary.
    // `resolver` opens the container directory (no link anywhere below the
    // root prefix).
    static Result<PropertyListPtr> readTrusted(Env& env, const PathResolver& resolver,
                                               const std::string& path);

private:
    static Result<std::string> readBytes(Env& env, const PathResolver& resolver,
                                         const std::string& path);
    static Status checkStatus(const struct stat& st, const std::string& path);
};

} // namespace quarn
