#pragma once
// A physical walk of one tree by descriptor, in the order of fts with
// FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV: directories before and after their
// contents, no sorting, links reported and never followed, mount points of
// other file systems reported but not entered.
//
// Iterative, with a bounded number of open descriptors whatever the depth
// (DirectoryStack); a directory moved away while the walk is below it ends
// the walk with ESTALE.

#include "Daemon/fs/DirectoryStack.h"
#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

namespace quarn {

class TreeWalker {
public:
    struct Failure {
        enum class Stage { Open, Entry, Close };
        Stage stage;
        int err;
        std::filesystem::path path; // the entry that failed
    };
    // Answers false to stop the walk. The entry's path is valid during the
    // call only.
    using Visit = std::function<bool(const QRNFileManager::TraversalEntry&)>;

    explicit TreeWalker(Env& env, std::size_t openLevels = DirectoryStack::kDefaultOpenLevels)
        : env_(env), openLevels_(openLevels) {}

    // Nothing when the walk ran to its end or the visitor stopped it.
    std::optional<Failure> walk(const std::filesystem::path& root, const Visit& visit);
    // The same for the item `name` of the open directory `parentFd`, which
    // `root` names in messages and entries: no link on the way to it is
    // followed again.
    std::optional<Failure> walk(int parentFd, const char* name, const std::filesystem::path& root,
                                const Visit& visit);

    std::uint64_t nodeCount() const { return nodes_; }
    bool stopped() const { return stopped_; }

private:
    void walkBelow(DirectoryStack& stack);
    void visitChild(DirectoryStack& stack, const std::string& name);
    // Reports the current directory's post-order entry and climbs out of it.
    void leaveDirectory(DirectoryStack& stack);
    bool report(const QRNFileManager::TraversalEntry& entry);
    void fail(Failure::Stage stage, int err, const std::string& path);
    bool done() const { return stopped_ || failure_.has_value(); }

    Env& env_;
    std::size_t openLevels_;
    const Visit* visit_ = nullptr;
    dev_t rootDev_ = 0;
    int rootParentFd_ = AT_FDCWD; // the open parent of the walk's root
    std::uint64_t nodes_ = 0;
    bool stopped_ = false;
    std::optional<Failure> failure_;
};

} // namespace quarn
