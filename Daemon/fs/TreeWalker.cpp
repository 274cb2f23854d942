#include "Daemon/fs/TreeWalker.h"

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
    return walk(AT_FDCWD, root.c_str(), root, visit);
}

std::optional<TreeWalker::Failure> TreeWalker::walk(int parentFd, const char* name,
                                                    const std::filesystem::path& root,
                                                    const Visit& visit) {
    visit_ = &visit;
    nodes_ = 0;
    stopped_ = false;
    failure_.reset();
    if (root.empty()) {
        return Failure{Failure::Stage::Open, ENOENT, root};
    }
    auto st = env_.fstatat(parentFd, name, AT_SYMLINK_NOFOLLOW);
    if (!st) {
        return Failure{Failure::Stage::Entry, st.error(), root};
    }
    rootDev_ = st->st_dev;
    Entry entry;
    entry.path = QRNFileManager::TraversalPath(&root.native());
    entry.name = root.filename().string();
    entry.status = *st;
    entry.kind = kindOf(st->st_mode);
    rootParentFd_ = parentFd;
    entry.parentFd = parentFd;
    if (!report(entry) || entry.kind != Entry::Kind::DirectoryPreOrder) {
        return std::nullopt;
    }
    // From an opened parent only the last name is walked; the path is for messages.
    DirectoryStack stack(env_, parentFd == AT_FDCWD ? std::string() : root.parent_path().string(),
                         openLevels_);
    if (auto pushed = stack.push(parentFd, name); !pushed) {
        return Failure{Failure::Stage::Entry, pushed.error(), root};
    }
    walkBelow(stack);
    stack.clear();
    if (failure_ || stopped_) {
        return failure_;
    }
    if (stack.closeError() != 0) {
        return Failure{Failure::Stage::Close, stack.closeError(), root};
    }
    return std::nullopt;
}

void TreeWalker::walkBelow(DirectoryStack& stack) {
    while (!stack.empty() && !done()) {
        auto next = stack.next();
        if (!next) {
            fail(Failure::Stage::Entry, next.error(), stack.path());
        } else if (*next == nullptr) {
            leaveDirectory(stack);
        } else {
            visitChild(stack, (*next)->name);
        }
    }
}

void TreeWalker::visitChild(DirectoryStack& stack, const std::string& name) {
    const int dirFd = stack.fd();
    const std::size_t mark = stack.appendToPath(name);
    auto st = env_.fstatat(dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW);
    if (!st) {
        fail(Failure::Stage::Entry, st.error(), stack.path());
        stack.truncatePath(mark);
        return;
    }
    Entry entry;
    entry.path = QRNFileManager::TraversalPath(&stack.path());
    entry.name = name;
    entry.level = static_cast<int>(stack.depth());
    entry.status = *st;
    entry.parentFd = dirFd;
    entry.kind = kindOf(st->st_mode);
    if (!report(entry) || entry.kind != Entry::Kind::DirectoryPreOrder) {
        stack.truncatePath(mark);
        return;
    }
    if (st->st_dev != rootDev_) {
        entry.kind = Entry::Kind::DirectoryPostOrder;
        report(entry);
        stack.truncatePath(mark);
        return;
    }
    stack.truncatePath(mark);
    if (auto pushed = stack.push(dirFd, name.c_str()); !pushed) {
        stack.appendToPath(name);
        fail(Failure::Stage::Entry, pushed.error(), stack.path());
        stack.truncatePath(mark);
    }
}

void TreeWalker::leaveDirectory(DirectoryStack& stack) {
    auto st = env_.fstat(stack.fd());
    if (!st) {
        fail(Failure::Stage::Entry, st.error(), stack.path());
        return;
    }
    const std::string name = stack.name();
    const int level = static_cast<int>(stack.depth()) - 1;
    if (auto popped = stack.pop(); !popped) {
        fail(Failure::Stage::Entry, popped.error(), stack.path());
        return;
    }
    const std::size_t mark = stack.appendToPath(name);
    Entry entry;
    entry.kind = Entry::Kind::DirectoryPostOrder;
    entry.path = QRNFileManager::TraversalPath(&stack.path());
    entry.name = level == 0 ? std::filesystem::path(name).filename().string() : name;
    entry.level = level;
    entry.status = *st;
    entry.parentFd = stack.empty() ? rootParentFd_ : stack.fd();
    report(entry);
    stack.truncatePath(mark);
}

bool TreeWalker::report(const Entry& entry) {
    ++nodes_;
    if (!(*visit_)(entry)) {
        stopped_ = true;
        return false;
    }
    return true;
}

void TreeWalker::fail(Failure::Stage stage, int err, const std::string& path) {
    if (!failure_) {
        failure_ = Failure{stage, err, path};
    }
}

} // namespace quarn
