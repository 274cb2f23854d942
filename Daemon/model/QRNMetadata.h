#pragma once
// The metadata file at the root of every container: whose it is, its
// identifier, class, UUID and free-form info. The container cache is
// rebuilt from these files, and every operation that finds a container on
// disk validates its metadata before trusting it.

#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class EnvFd;
class QRNMetadata;
using QRNMetadataPtr = std::shared_ptr<const QRNMetadata>;

class QRNMetadata {
public:
    static constexpr std::string_view kFileName = ".com.orvex.quarn_store.metadata.plist";
    static constexpr std::string_view kIdentifierKey = "QRNMetadataIdentifier";
    static constexpr std::string_view kUUIDKey = "QRNMetadataUUID";
    static constexpr std::string_view kContentClassKey = "QRNMetadataContentClass";
    static constexpr std::string_view kUserIdentityKey = "QRNMetadataUserIdentity";
    static constexpr std::string_view kInfoKey = "QRNMetadataInfo";
    static constexpr std::string_view kUserManagedAssetsDirNameKey =
        "QRNMetadataUserManagedAssetsDirName";
    static constexpr std::string_view kVersionKey = "QRNMetadataVersion";
    // Read only: the owner uid that older files carry.
    static constexpr std::string_view kLegacyPersonaKey = "QRNMetadataPersona";
    static constexpr std::string_view kVersion = "2";

    // `info` is a dictionary or none; `url` the container directory (a path
    // converts).
    QRNMetadata(QRNConcreteContainerIdentityPtr containerIdentity, Value info, std::string url,
                std::optional<std::string> userManagedAssetsDirName);

    // Writes the file at `url` (the metadata file's own URL) through a
    // temporary file in the daemon's root-only scratch directory, renamed
    // over the final file in the container directory, which is opened
    // without following a link. Code 34 on failure; the old file is then
    // left as it was.
    Status writeMetadataToFileURL(const std::filesystem::path& url) const;
    // The same into the open container directory (`containerURL` names it
    // in messages).
    Status writeMetadataInDirectory(const EnvFd& container,
                                    const std::filesystem::path& containerURL) const;

    // Reads and validates the metadata file at `url` against the identity
    // the caller expects. With `checkClassPath` the container must also lie
    // in the class directory the layout gives. Code 12 (unreadable) or 29
    // (invalid content).
    static CodeResult<QRNMetadataPtr>
    readAndValidateMetadataAtFileUrl(const std::filesystem::path& url,
                                     const QRNUserIdentityPtr& userIdentity, bool checkClassPath);

    // What one run of reads (a class-directory scan) shares: files of one
    // directory carry the same stored user identity, and turning it into an
    // identity is much of a read. Kept for one run only, so the identity
    // cache's answers stay current.
    struct ReadMemo {
        Value stored;
        QRNUserIdentityPtr userIdentity;
    };
    // The same, for a path held as a string (no path object is built).
    static CodeResult<QRNMetadataPtr>
    readAndValidateMetadataAtFilePath(const std::string& path,
                                      const QRNUserIdentityPtr& userIdentity, bool checkClassPath,
                                      ReadMemo* memo);

    const QRNConcreteContainerIdentityPtr& containerIdentity() const { return containerIdentity_; }
    const QRNUserIdentityPtr& userIdentity() const { return containerIdentity_->userIdentity(); }
    const UUID& uuid() const { return containerIdentity_->uuid(); }
    std::uint64_t containerClass() const { return containerIdentity_->containerClass(); }
    const std::string& identifier() const { return containerIdentity_->identifier(); }
    const Value& info() const { return info_; }
    // Kept as a string: a path object holds every component apart, several
    // times the string's size in every cached record.
    std::filesystem::path url() const { return url_; }
    const std::string& urlString() const { return url_; }
    const std::optional<std::string>& userManagedAssetsDirName() const {
        return userManagedAssetsDirName_;
    }

    // The dictionary the file holds.
    Value dictionary() const;
    std::string description() const;

private:
    QRNConcreteContainerIdentityPtr containerIdentity_;
    Value info_;
    std::string url_;
    std::optional<std::string> userManagedAssetsDirName_;
};

} // namespace quarn
