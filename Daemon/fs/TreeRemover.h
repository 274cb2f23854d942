#pragma once
// Depth-first removal of a tree by descriptor: every call is made relative
// to an open directory with a name read from that directory, so a link
// anywhere in the tree is removed, never followed.
//
// Iterative, with a bounded number of open descriptors whatever the depth
// (DirectoryStack). A directory moved away while the removal is below it
// stops the removal (ESTALE): its new parent is never touched.
//
// Per-entry failures do not stop the walk: the rest of the tree is still
// removed and the first failure's errno is kept. An entry that cannot be
// removed because it (or the directory holding it) is immutable has that
// flag cleared and is removed after all.

#include "Daemon/fs/DirectoryStack.h"
#include "Daemon/fs/Env.h"

#include <string>

namespace quarn {

class TreeRemover {
public:
    explicit TreeRemover(Env& env, std::size_t openLevels = DirectoryStack::kDefaultOpenLevels)
        : env_(env), openLevels_(openLevels) {}

    // Removes `name` inside the open directory `parentFd` (whose path is
    // `parentPath`, used for messages only; that directory itself is never
    // changed). A missing entry is not a failure.
    void removeTree(int parentFd, const std::string& parentPath, const char* name);

    // The first failure's errno, or 0.
    int firstError() const { return firstError_; }

private:
    // Where an entry lies: `parentInTree` says whether its directory belongs
    // to the tree being removed (and so may have its immutable flag cleared).
    struct Place {
        int parentFd;
        bool parentInTree;
    };

    Place placeIn(const DirectoryStack& stack) const;
    void removeEntry(DirectoryStack& stack, const char* name, unsigned char type);
    void enterDirectory(DirectoryStack& stack, const char* name);
    // Climbs out of the current directory, which is then empty, and removes it.
    void finishDirectory(DirectoryStack& stack);
    // The error callback: ENOENT is success, an immutable flag in the way is
    // cleared and the removal retried, anything else is recorded.
    void handleFailure(DirectoryStack& stack, const char* name, bool isDirectory, int err);
    bool clearBlockingFlags(DirectoryStack& stack, const char* name, const std::string& path);
    bool clearImmutable(int fd, const std::string& path);
    bool isImmutable(int fd);
    void record(int err);

    Env& env_;
    std::size_t openLevels_;
    int rootParentFd_ = -1;
    int firstError_ = 0;
};

} // namespace quarn
