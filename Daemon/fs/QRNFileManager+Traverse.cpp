// Tree traversal and the diagnostic listing of a tree.

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/fs/TreeWalker.h"
#include "Daemon/platform/Accounts.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Signpost.h"

#include <cstring>
#include <map>

namespace quarn {

Status QRNFileManager::_traverseDirectory(const std::filesystem::path& url,
                                          const TraversalBlock& block) {
    Signpost signpost(LogCategory::Fs, "TraversingDirectory", url.string());
    std::optional<Error> blockError;
    TreeWalker walker(*env_);
    const auto visit = [&](const TraversalEntry& entry) {
        auto status = block(entry);
        if (!status) {
            blockError = status.error();
            return false;
        }
        return true;
    };
    // The root's parent is opened without links below the root prefix, so
    // the walk starts in the directory the path names, not where a link leads.
    // ("/" has no parent to open: it is walked as it is.)
    auto parent = resolver().openParent(url);
    std::optional<TreeWalker::Failure> failure;
    if (parent) {
        failure = walker.walk(parent->directory.get(), parent->name.c_str(), url, visit);
    } else if (parent.error() == EINVAL) {
        failure = walker.walk(url, visit);
    } else {
        failure = TreeWalker::Failure{TreeWalker::Failure::Stage::Open, parent.error(), url};
    }
    signpost.end(fmt::format("{} nodes", walker.nodeCount()));
    if (blockError) {
        return QRN_UNEXPECTED(*blockError);
    }
    if (!failure) {
        return {};
    }
    const char* reason = std::strerror(failure->err);
    switch (failure->stage) {
    case TreeWalker::Failure::Stage::Open:
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(failure->err, "fts_open failed for {} with error {}",
                                              url.string(), reason));
    case TreeWalker::Failure::Stage::Close:
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(failure->err, "fts_close failed for {} with error {}",
                                              url.string(), reason));
    case TreeWalker::Failure::Stage::Entry:
        break;
    }
    return QRN_UNEXPECTED(
        QRN_POSIX_ERROR(failure->err, "Error for path {}: {}", url.string(), reason));
}

void QRNFileManager::printDirectoryStructureAtURL(const std::filesystem::path& url) {
    // An orphaned file is one whose owner has no account: nobody can claim it.
    auto& accounts = context_->instance<Accounts>();
    std::map<uid_t, bool> known;
    auto hasAccount = [&](uid_t uid) {
        auto it = known.find(uid);
        if (it == known.end()) {
            it = known.emplace(uid, accounts.userByUID(uid).has_value()).first;
        }
        return it->second;
    };
    QRN_LOG_NOTICE(LogCategory::Fs, "Directory structure of {}:", url.string());
    TreeWalker walker(*env_);
    auto failure = walker.walk(url, [&](const TraversalEntry& entry) {
        if (entry.kind == TraversalEntry::Kind::DirectoryPostOrder) {
            return true;
        }
        const std::string indent(static_cast<std::size_t>(entry.level) * 2, ' ');
        QRN_LOG_NOTICE(LogCategory::Fs, "\t{}{}{} (uid {}, gid {}, mode {:o})", indent, entry.name,
                       entry.isDirectory() ? "/" : "", entry.status.st_uid, entry.status.st_gid,
                       entry.status.st_mode & 07777);
        if (!hasAccount(entry.status.st_uid)) {
            QRN_LOG_NOTICE(LogCategory::Fs, "\tOrphaned File: {}", entry.path.string());
        }
        return true;
    });
    if (!failure) {
        return;
    }
    if (failure->stage == TreeWalker::Failure::Stage::Open) {
        QRN_LOG_ERROR(LogCategory::Fs, "fts_open failed for {} : {}", url.string(),
                      std::strerror(failure->err));
    } else {
        QRN_LOG_ERROR(LogCategory::Fs, "FTS returned error for {} : {}", failure->path.string(),
                      std::strerror(failure->err));
    }
}

} // namespace quarn
