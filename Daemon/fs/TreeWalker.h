#pragma once
// A physical walk of one tree by descriptor, in the order of fts with
// FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV: directories before and after their
// contents, no sorting, links reported and never followed, mount points of
// other file systems reported but not entered.

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
    // Answers false to stop the walk.
    using Visit = std::function<bool(const QRNFileManager::TraversalEntry&)>;

    explicit TreeWalker(Env& env) : env_(env) {}

    // Nothing when the walk ran to its end or the visitor stopped it.
    std::optional<Failure> walk(const std::filesystem::path& root, const Visit& visit);

    std::uint64_t nodeCount() const { return nodes_; }
    bool stopped() const { return stopped_; }

private:
    // `openName` reaches the entry from `parentFd`.
    void visitEntry(int parentFd, const char* openName, QRNFileManager::TraversalEntry& entry);
    void visitDirectory(int parentFd, const char* openName, QRNFileManager::TraversalEntry& entry);
    void visitChildren(DIR* dir, const QRNFileManager::TraversalEntry& parent);
    bool report(const QRNFileManager::TraversalEntry& entry);
    void fail(Failure::Stage stage, int err, const std::filesystem::path& path);
    bool done() const { return stopped_ || failure_.has_value(); }

    Env& env_;
    const Visit* visit_ = nullptr;
    dev_t rootDev_ = 0;
    std::uint64_t nodes_ = 0;
    bool stopped_ = false;
    std::optional<Failure> failure_;
    std::optional<Failure> closeFailure_; // reported only when nothing else failed
};

} // namespace quarn
