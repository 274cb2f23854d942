#pragma once
// The directories a walk is inside, from its first level down to the
// current one, holding a bounded number of descriptors whatever the depth:
// only the deepest levels stay open. A level above them is opened again
// through ".." of its child when the walk climbs back, and used only when
// it is still the directory that was walked into (same device and inode):
// users may move their directories at any moment, and the daemon, as root,
// must never carry on in a directory it did not enter.
//
// A level that is closed keeps the names it had not listed yet, so the
// walk resumes where it left. Memory per level is a few dozen bytes plus
// those names; the path of the current level is kept in one buffer.

#include "Daemon/fs/EnvFd.h"

#include <sys/stat.h>

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class DirectoryStack {
public:
    static constexpr std::size_t kDefaultOpenLevels = 32;

    struct Child {
        std::string name;
        unsigned char type = DT_UNKNOWN; // d_type
    };

    // `basePath` is the path of the directory holding the first level
    // (empty when the first level's name is a whole path); for messages.
    DirectoryStack(Env& env, std::string basePath, std::size_t openLevels = kDefaultOpenLevels);
    ~DirectoryStack();
    DirectoryStack(const DirectoryStack&) = delete;
    DirectoryStack& operator=(const DirectoryStack&) = delete;

    // Opens the directory `name` in `parentFd` (never through a link) and
    // makes it the current level; answers its status. Without `list` the
    // level is never listed (next() must not be called on it).
    SysResult<struct stat> push(int parentFd, const char* name, bool list = true);
    // Leaves the current level; the level above becomes current, opened
    // again when it had been closed. ESTALE when that directory is no longer
    // the one walked into: every level is then dropped (the walk must stop)
    // and path() still names the level left.
    SysStatus pop();
    // Forgets every level (after a failure).
    void clear();

    bool empty() const { return levels_.empty(); }
    std::size_t depth() const { return levels_.size(); }
    // The current level's descriptor, always open.
    int fd() const;
    // The current level's next entry ("." and ".." left out); nullptr at
    // the end of its listing.
    SysResult<const Child*> next();

    // The current level's path, and its last component.
    const std::string& path() const { return path_; }
    std::string name() const;
    // Appends "/<name>" to the path (for a child's messages); undo with
    // truncatePath(answer).
    std::size_t appendToPath(std::string_view name);
    void truncatePath(std::size_t size) { path_.resize(size); }

    // The first error a descriptor's close reported, or 0.
    int closeError() const { return closeError_; }
    std::size_t openDescriptors() const { return levels_.size() - firstOpen_; }

private:
    // Names a closed level had not listed yet, and the listing's error.
    struct Unlisted {
        std::vector<Child> names;
        std::size_t at = 0;
        int err = 0;
    };
    struct Level {
        EnvFd dir; // with a directory stream once listing began
        dev_t dev = 0;
        ino_t ino = 0;
        std::size_t nameAt = 0; // where its name begins in path_
        std::size_t pathEnd = 0;
        std::unique_ptr<Unlisted> unlisted; // set once closed after listing began
    };

    void evictOldest();
    void dropLevels();
    SysStatus reopen(Level& level, int childFd);
    void close(EnvFd& fd);

    Env& env_;
    std::size_t openLevels_;
    std::string path_;
    std::size_t basePathSize_;
    std::vector<Level> levels_;
    std::size_t firstOpen_ = 0; // levels [firstOpen_, depth) hold descriptors
    Child current_;
    int closeError_ = 0;
};

} // namespace quarn
