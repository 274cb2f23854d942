#pragma once
// The one place where the daemon touches the file system below the level of
// containers: containment checks, directory creation with mode, owner and
// protection class, removal (clearing the immutable flag where it blocks),
// moves and copies with a copy-then-remove fallback across file systems,
// temporary directories, ACLs of system containers, ownership, protection
// classes and disk usage.
//
// Stateless apart from its Env (the system-call seam), so it may be called
// from any thread. Paths are absolute and already below the root prefix.
// Trees are walked by descriptor and symbolic links are never followed.
//
// The operations are spread over files by concern:
// QRNFileManager.cpp (construction, existence, home directory),
// +Create, +Remove, +Copy, +Move, +Traverse, +Listing, +Containment, +ACL,
// +Ownership, +Protection, +DiskUsage.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/PathResolver.h"
#include "Daemon/support/QRNError.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <ostream>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class Env;
class QRNDaemonContext;

class QRNFileManager {
public:
    // A data protection class that means "leave the class alone".
    static constexpr int kProtectionClassUnchanged = -1;
    static constexpr std::string_view kDefaultTemporaryPrefix = "temp.";

    // The short forms of createDirectoryAtURL take one of these so that an
    // owner can never be taken for a class or the other way round.
    struct Owner {
        uid_t uid;
    };
    struct ProtectionClass {
        int value;
    };

    // One entry of a listing: a path inside the listed directory.
    struct Item {
        std::filesystem::path url;
        bool isDirectory = false;
    };

    // The path of a traversal entry: a view of the walk's own buffer, valid
    // during the visit only. Copying a deep tree's long paths once per entry
    // would cost the square of its depth.
    class TraversalPath {
    public:
        TraversalPath() = default;
        explicit TraversalPath(const std::string* buffer) : buffer_(buffer) {}
        const std::string& string() const { return buffer_ ? *buffer_ : empty(); }
        const char* c_str() const { return string().c_str(); }
        operator std::filesystem::path() const { return string(); }
        friend std::ostream& operator<<(std::ostream& out, const TraversalPath& path) {
            return out << path.string();
        }

    private:
        static const std::string& empty() {
            static const std::string none;
            return none;
        }
        const std::string* buffer_ = nullptr;
    };

    // One entry of a traversal, in walk order. Directories come twice: before
    // their contents (DirectoryPreOrder) and after (DirectoryPostOrder).
    // Mount points of other file systems are reported but not entered.
    struct TraversalEntry {
        enum class Kind { DirectoryPreOrder, DirectoryPostOrder, File, Symlink, Other };
        Kind kind = Kind::File;
        TraversalPath path;    // full path
        std::string name;      // last component
        int level = 0;         // 0 for the root of the walk
        struct stat status {}; // lstat of the entry
        // Open directory holding the entry (AT_FDCWD for the root, whose
        // `path` is then used): calls by (parentFd, name) never follow a link.
        int parentFd = AT_FDCWD;
        bool isDirectory() const {
            return kind == Kind::DirectoryPreOrder || kind == Kind::DirectoryPostOrder;
        }
    };
    // Returning an error stops the walk; the traversal then fails with it.
    using TraversalBlock = std::function<Status(const TraversalEntry&)>;

    // Uses the context's installed Env, or the system's when none is.
    explicit QRNFileManager(QRNDaemonContext& context);
    QRNFileManager(QRNDaemonContext& context, std::shared_ptr<Env> env);

    // The current daemon context's instance.
    static QRNFileManager& defaultManager();

    Env& env() const { return *env_; }

    // --- Resolution by descriptor ------------------------------------------

    // Resolves paths below the context's root prefix without following links.
    const PathResolver& resolver() const;
    // The directory itself, opened for reading (never through a link);
    // a refusal or failure is logged.
    Result<EnvFd> openDirectoryAtURL(const std::filesystem::path& url);
    // Whether `relative` exists below the open directory, no link followed
    // on the way (a link as the last name counts as existing).
    bool itemExistsInDirectory(const EnvFd& dir, const std::string& relative);

    // --- Removal, creation, moves and copies -------------------------------

    // Recursive removal; a missing item is success.
    Status removeItemAtURL(const std::filesystem::path& url);

    Status createDirectoryAtURL(const std::filesystem::path& url, bool withIntermediateDirectories,
                                mode_t mode, uid_t owner, int protectionClass);
    Status createDirectoryAtURL(const std::filesystem::path& url, bool withIntermediateDirectories,
                                mode_t mode, Owner owner);
    Status createDirectoryAtURL(const std::filesystem::path& url, bool withIntermediateDirectories,
                                mode_t mode, ProtectionClass protectionClass);
    Status createDirectoryAtURL(const std::filesystem::path& url, bool withIntermediateDirectories,
                                mode_t mode);
    // As createDirectoryAtURL, answering the directory open (never through
    // a link at its name) for making items below it without walking its
    // path again.
    Result<EnvFd> createAndOpenDirectoryAtURL(const std::filesystem::path& url,
                                              bool withIntermediateDirectories, mode_t mode,
                                              uid_t owner, int protectionClass);
    // The same below the open directory `parent` (whose path is `parentURL`,
    // for messages): `relative` goes only downwards, its missing levels are
    // made with `mode`, and no link is followed on the way.
    Result<EnvFd> createAndOpenDirectoryInDirectory(const EnvFd& parent,
                                                    const std::filesystem::path& parentURL,
                                                    const std::filesystem::path& relative,
                                                    mode_t mode, uid_t owner, int protectionClass);

    // Both parents are opened by descriptor (never through a link below the
    // root prefix) and the item is renamed by name.
    Status moveItemAtURL(const std::filesystem::path& src, const std::filesystem::path& dst);
    // `srcName` of the open directory `srcDir` to `dstName` of `dstDir`; the
    // URLs name the directories in messages only. Across file systems the
    // item is copied and removed, by descriptor as well.
    Status moveItemInDirectory(const EnvFd& srcDir, const std::filesystem::path& srcDirURL,
                               const std::string& srcName, const EnvFd& dstDir,
                               const std::filesystem::path& dstDirURL, const std::string& dstName);
    // Moves `name` of the open directory into a new, uniquely named
    // directory in the root-only `directory` (checked and repaired first),
    // keeping its name. Answers the item's new path; ENOENT when it is gone.
    Result<std::filesystem::path> moveItemInDirectoryToNewUniqueDirectory(
        const EnvFd& srcDir, const std::filesystem::path& srcDirURL, const std::string& name,
        const std::filesystem::path& directory);
    Status moveItemIfExistsAtURL(const std::filesystem::path& src,
                                 const std::filesystem::path& dst);
    Status _moveItemAtURL(const std::filesystem::path& src, const std::filesystem::path& dst,
                          bool failIfSrcMissing);

    // The destination must not exist; a copy that fails part way is removed.
    Status copyItemAtURL(const std::filesystem::path& src, const std::filesystem::path& dst);
    Status copyItemIfExistsAtURL(const std::filesystem::path& src,
                                 const std::filesystem::path& dst);
    Status _copyItemAtURL(const std::filesystem::path& src, const std::filesystem::path& dst,
                          bool failIfSrcMissing);

    Result<std::filesystem::path>
    createTemporaryDirectoryInDirectoryURL(const std::filesystem::path& directory,
                                           std::string_view namePrefix);
    Result<std::filesystem::path>
    createTemporaryDirectoryInDirectoryURL(const std::filesystem::path& directory);

    // --- Root-only directories and temporary files ----------------------------

    // Opens (making it when missing) a directory of the daemon's own, and
    // checks it on the descriptor: owner root, and no write for group and
    // others (no access at all when `mode` grants them none). A wrong owner
    // or mode is logged and repaired.
    Result<EnvFd> openRootOnlyDirectoryAtURL(const std::filesystem::path& url, mode_t mode);
    // A new file `name` (O_CREAT | O_EXCL | O_NOFOLLOW) in the open directory,
    // which must be owned by root and writable by nobody else: an existing
    // name, link or not, is refused (EEXIST), as is a directory others may
    // write to (EPERM).
    Result<EnvFd> createTemporaryFileInDirectory(const EnvFd& dir,
                                                 const std::filesystem::path& dirURL,
                                                 const std::string& name);
    // Replaces `name` in the open `directory` with a file holding `bytes`:
    // written as `temporaryName` in the root-only `scratchDirectory` (a
    // leftover of that name is removed first), given `protectionClass`
    // (none when negative) and renamed into place by descriptors.
    struct FileReplacement {
        const std::filesystem::path& scratchDirectory;
        const std::string& temporaryName;
        int protectionClass = kProtectionClassUnchanged;
    };
    Status replaceFileInDirectory(const EnvFd& directory, const std::filesystem::path& directoryURL,
                                  const std::string& name, std::span<const std::uint8_t> bytes,
                                  const FileReplacement& replacement);

    // --- Walking and listing ------------------------------------------------

    Status _traverseDirectory(const std::filesystem::path& url, const TraversalBlock& block);

    // The entries of one directory; names beginning with "." are left out.
    Result<std::vector<Item>> urlsForItemsInDirectoryAtURL(const std::filesystem::path& url);
    // The same, with the listed directory kept open: its entries are then
    // moved by name from this descriptor, never by their paths, so a swap
    // of the directory after the listing cannot redirect them.
    struct Listing {
        EnvFd directory;
        std::filesystem::path url;
        std::vector<Item> items;
    };
    Result<Listing> listDirectoryAtURL(const std::filesystem::path& url);

    // lstat-based: a dangling link exists.
    bool itemExistsAtURL(const std::filesystem::path& url);
    bool itemDoesNotExistAtURL(const std::filesystem::path& url);

    // Writes the tree to the log; changes nothing.
    void printDirectoryStructureAtURL(const std::filesystem::path& url);

    // --- Containment ----------------------------------------------------------

    // The real location of `suspicious` if it lies inside `base`, else nothing.
    std::optional<std::filesystem::path> realPathForURL(const std::filesystem::path& suspicious,
                                                        const std::filesystem::path& base);
    // Depth walk over a link target: the ending depth, or nothing when the
    // running depth falls below `startingDepth`.
    std::optional<int> _validateSymlink(std::string_view path, int startingDepth);
    std::optional<std::filesystem::path> _realPathForURL(const std::filesystem::path& url,
                                                         bool allowNonExistentPathComponents);
    std::optional<std::filesystem::path>
    _realPathWhatExistsInPath(const std::filesystem::path& url);

    // --- ACLs and ownership ---------------------------------------------------

    Status setTopLevelSystemContainerACLAtURL(const std::filesystem::path& url);
    Status standardizeACLsAtURL(const std::filesystem::path& url, bool isSystemContainer);
    Status standardizeACLsForSystemContainerAtURL(const std::filesystem::path& url);
    Status standardizeAllSystemContainerACLsAtURL(const std::filesystem::path& url);
    Status standardizeOwnershipAtURL(const std::filesystem::path& url, uid_t uid, gid_t gid);

    // --- Data protection --------------------------------------------------------

    Result<int> dataProtectionClassOfItemAtURL(const std::filesystem::path& url);
    // With a predicate, the current class is read first and nothing changes
    // (successfully) when the predicate answers false.
    Status setDataProtectionClassOfItemAtURL(const std::filesystem::path& url, int protectionClass,
                                             std::function<bool(int)> predicate = nullptr);

    // --- Disk usage (bytes; negative on failure) -------------------------------

    std::int64_t fastDiskUsageForURL(const std::filesystem::path& url);
    std::int64_t diskUsageForURL(const std::filesystem::path& url);

    // --- Accounts ---------------------------------------------------------------

    // The user's home directory, real path; "/private/var/mobile" below the
    // root when the user is unknown.
    static std::filesystem::path homeDirectoryURLForPOSIXUID(uid_t uid);

private:
    QRNDaemonContext* context_;
    std::shared_ptr<Env> env_;
    // Made on first use: the root prefix is only known once the context is.
    mutable std::once_flag resolverOnce_;
    mutable std::unique_ptr<PathResolver> resolver_;
    // The attribute holding a protection class: the daemon's effective user,
    // which picks its namespace, does not change while it runs.
    const char* protectionAttribute_;
};

} // namespace quarn
