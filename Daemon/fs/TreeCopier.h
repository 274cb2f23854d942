#pragma once
// Recursive copy by descriptor of data and metadata: contents (cloned where
// the file system can, else copy_file_range, else read/write), extended
// attributes (POSIX ACLs among them), owner, mode and times, directories'
// after their contents. Links are copied as links; nothing is followed at
// the source or the destination. Hard links are copied as separate files.
//
// Iterative, with a bounded number of open descriptors whatever the depth
// (DirectoryStack). The first failure stops the copy; the caller removes
// what was made.

#include "Daemon/fs/DirectoryStack.h"
#include "Daemon/fs/Env.h"

#include <sys/stat.h>

#include <cstdint>
#include <string>

namespace quarn {

class TreeCopier {
public:
    explicit TreeCopier(Env& env) : env_(env) {}

    // Copies `srcName` in the open directory `srcParentFd` to `dstName` in
    // `dstParentFd`, which must not exist. Answers 0 or an errno.
    int copy(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName);

    // Whether anything was made at the destination (to be cleaned up).
    bool madeDestination() const { return madeDestination_; }

private:
    // Source and destination directories, level for level.
    struct Stacks {
        DirectoryStack src;
        DirectoryStack dst;
    };

    int copyBelow(Stacks& stacks);
    int copyChild(Stacks& stacks, const char* name);
    int copyLeaf(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName,
                 const struct stat& st);
    // Makes the destination directory and enters both.
    int enterDirectory(Stacks& stacks, int srcParentFd, const char* srcName, int dstParentFd,
                       const char* dstName);
    // Gives the finished destination directory its attributes, then climbs
    // out of both.
    int leaveDirectory(Stacks& stacks);
    int copyFile(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName,
                 const struct stat& st);
    int copyData(int srcFd, int dstFd);
    int copyByReading(int srcFd, int dstFd);
    int copySymlink(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName,
                    const struct stat& st);
    int copyNode(int dstParentFd, const char* dstName, const struct stat& st);
    int copyExtendedAttributes(int srcFd, int dstFd);
    int copyAttribute(int srcFd, int dstFd, const char* name);
    // Owner, then mode (a chown clears set-id bits), then times.
    int applyOwnerModeTimes(int dstFd, const struct stat& st);

    Env& env_;
    bool madeDestination_ = false;
    bool depth0_ = true;
    // The destination's root directory, so a copy into its own source does
    // not copy itself again.
    dev_t dstRootDev_ = 0;
    ino_t dstRootIno_ = 0;
    bool cloneWorks_ = true; // cleared at the first refusal: same file systems throughout
    bool copyRangeWorks_ = true;
};

} // namespace quarn
