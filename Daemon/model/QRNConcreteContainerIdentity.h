#pragma once
// A container identity together with the UUID that names the container's
// directory on disk. Equal only to another concrete identity with the same
// UUID (while a plain identity compares equal to it, ignoring the UUID).

#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/support/UUID.h"

namespace quarn {

class QRNConcreteContainerIdentity;
using QRNConcreteContainerIdentityPtr = std::shared_ptr<const QRNConcreteContainerIdentity>;

class QRNConcreteContainerIdentity final : public QRNContainerIdentity {
public:
    // Logs "You cannot init this class directly." and answers nullptr.
    static QRNConcreteContainerIdentityPtr init();

    // The base checks first, then the UUID.
    static CodeResult<QRNConcreteContainerIdentityPtr>
    containerIdentityWithUUID(const UUID& uuid, QRNUserIdentityPtr userIdentity,
                              std::string identifier, std::uint64_t containerClass);
    // Identifier and UUID as a request dictionary or a file hands them: the
    // UUID must be a UUID value.
    static CodeResult<QRNConcreteContainerIdentityPtr>
    containerIdentityWithUUID(const Value* uuid, QRNUserIdentityPtr userIdentity,
                              const Value* identifier, std::uint64_t containerClass);

    const UUID& uuid() const { return uuid_; }

    bool isEqualToConcreteContainerIdentity(const QRNConcreteContainerIdentity& other) const;
    bool isEqual(const QRNContainerIdentity& other) const override;
    std::size_t hash() const override;
    std::string description() const override;

private:
    QRNConcreteContainerIdentity(const UUID& uuid, QRNUserIdentityPtr userIdentity,
                                 std::string identifier, std::uint64_t containerClass);

    static std::uint64_t initWithUUID(const Value* uuid, const QRNUserIdentityPtr& userIdentity,
                                      const Value* identifier, std::uint64_t containerClass);

    UUID uuid_;
};

} // namespace quarn
