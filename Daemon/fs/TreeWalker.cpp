#include "Daemon/fs/TreeWalker.h"

#include "Daemon/fs/DirectoryEntryName.h"
#include "Daemon/fs/EnvFd.h"

#include <fcntl.h>

namespace quarn {

using Entry = QRNFileManager::TraversalEntry;

namespace {

Entry::Kind kindOf(mode_t mode) {
    switch (mode & S_IFMT) {
    case S_IFDIR:
        return Entry::Kind::DirectoryPreOrder;
    case S_IFREG:
        return Entry::Kind::File;
    case S_IFLNK:
        return Entry::Kind::Symlink;
    default:
        return Entry::Kind::Other;
    }
}

} // namespace

std::optional<TreeWalker::Failure> TreeWalker::walk(const std::filesystem::path& root,
                                                    const Visit& visit) {
    visit_ = &visit;
    nodes_ = 0;
    stopped_ = false;
    failure_.reset();
    closeFailure_.reset();
    if (root.empty()) {
        return Failure{Failure::Stage::Open, ENOENT, root};
    }
    auto st = env_.fstatat(AT_FDCWD, root.c_str(), AT_SYMLINK_NOFOLLOW);
    if (!st) {
        return Failure{Failure::Stage::Entry, st.error(), root};
    }
    rootDev_ = st->st_dev;
    Entry entry;
    entry.path = root;
    entry.name = root.filename().string();
    entry.level = 0;
    entry.status = *st;
    entry.parentFd = AT_FDCWD;
    visitEntry(AT_FDCWD, root.c_str(), entry);
    if (failure_) {
        return failure_;
    }
    return stopped_ ? std::nullopt : closeFailure_;
}

void TreeWalker::visitEntry(int parentFd, const char* openName, Entry& entry) {
    entry.kind = kindOf(entry.status.st_mode);
    if (entry.kind == Entry::Kind::DirectoryPreOrder) {
        visitDirectory(parentFd, openName, entry);
    } else {
        report(entry);
    }
}

void TreeWalker::visitDirectory(int parentFd, const char* openName, Entry& entry) {
    if (!report(entry)) {
        return;
    }
    if (entry.status.st_dev == rootDev_) {
        auto opened =
            env_.openat(parentFd, openName, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK);
        if (!opened) {
            fail(Failure::Stage::Entry, opened.error(), entry.path);
            return;
        }
        EnvFd dir(env_, *opened);
        if (auto stream = dir.openDirectoryStream(); !stream) {
            fail(Failure::Stage::Entry, stream.error(), entry.path);
            return;
        }
        visitChildren(dir.dir(), entry);
        if (auto closed = dir.close(); !closed && !closeFailure_) {
            closeFailure_ = Failure{Failure::Stage::Close, closed.error(), entry.path};
        }
        if (done()) {
            return;
        }
    }
    entry.kind = Entry::Kind::DirectoryPostOrder;
    report(entry);
}

void TreeWalker::visitChildren(DIR* dir, const Entry& parent) {
    const int dirFd = dirfd(dir);
    while (!done()) {
        auto read = env_.readdir(dir);
        if (!read) {
            fail(Failure::Stage::Entry, read.error(), parent.path);
            return;
        }
        if (*read == nullptr) {
            return;
        }
        const char* name = (*read)->d_name;
        if (DirectoryEntryName::isDot(name)) {
            continue;
        }
        auto st = env_.fstatat(dirFd, name, AT_SYMLINK_NOFOLLOW);
        if (!st) {
            fail(Failure::Stage::Entry, st.error(), parent.path / name);
            return;
        }
        Entry child;
        child.path = parent.path / name;
        child.name = name;
        child.level = parent.level + 1;
        child.status = *st;
        child.parentFd = dirFd;
        visitEntry(dirFd, name, child);
    }
}

bool TreeWalker::report(const Entry& entry) {
    ++nodes_;
    if (!(*visit_)(entry)) {
        stopped_ = true;
        return false;
    }
    return true;
}

void TreeWalker::fail(Failure::Stage stage, int err, const std::filesystem::path& path) {
    if (!failure_) {
        failure_ = Failure{stage, err, path};
    }
}

} // namespace quarn
