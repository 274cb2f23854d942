#pragma once
// What names a container: user identity + identifier + class. Immutable;
// shared as std::shared_ptr<const QRNContainerIdentity>.
//
// There is no default constructor: `init()` is the one way to ask for an
// identity without fields, and it logs "You cannot init this class
// directly." and answers nullptr.

#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <memory>
#include <string>

namespace quarn {

class QRNContainerIdentity;
using QRNContainerIdentityPtr = std::shared_ptr<const QRNContainerIdentity>;

class QRNContainerIdentity {
public:
    virtual ~QRNContainerIdentity() = default;

    static QRNContainerIdentityPtr init();

    // Checks, in order: a user identity (11), an identifier (18), a string
    // identifier (11), a class in 1..13 (11).
    static CodeResult<QRNContainerIdentityPtr>
    containerIdentityWithUserIdentity(QRNUserIdentityPtr userIdentity, std::string identifier,
                                      std::uint64_t containerClass);
    // The identifier as a request dictionary hands it: nullptr or a none
    // Value is a missing identifier, anything but a string is refused.
    static CodeResult<QRNContainerIdentityPtr>
    containerIdentityWithUserIdentity(QRNUserIdentityPtr userIdentity, const Value* identifier,
                                      std::uint64_t containerClass);
    // For classes that need no user identity: uses the default identity.
    static CodeResult<QRNContainerIdentityPtr>
    containerIdentityWithIdentifier(std::string identifier, std::uint64_t containerClass);

    const std::string& identifier() const { return identifier_; }
    std::uint64_t containerClass() const { return containerClass_; }
    const QRNUserIdentityPtr& userIdentity() const { return userIdentity_; }

    // Identifier, user identity and class; a concrete identity's UUID is
    // not looked at.
    bool isEqualToContainerIdentity(const QRNContainerIdentity& other) const;
    // The same object, or equal as the receiver's kind of identity defines it.
    virtual bool isEqual(const QRNContainerIdentity& other) const;
    virtual std::size_t hash() const;
    virtual std::string description() const;

    // For unordered containers keyed by identities (equality as the stored
    // key's isEqual answers).
    struct Hash {
        std::size_t operator()(const QRNContainerIdentityPtr& i) const { return i ? i->hash() : 0; }
    };
    struct Equal {
        bool operator()(const QRNContainerIdentityPtr& a, const QRNContainerIdentityPtr& b) const {
            return a == b || (a && b && a->isEqual(*b));
        }
    };

protected:
    QRNContainerIdentity(QRNUserIdentityPtr userIdentity, std::string identifier,
                         std::uint64_t containerClass);
    QRNContainerIdentity(const QRNContainerIdentity&) = default;

    // The initialiser's checks; kQRNErrorNone when they pass.
    static std::uint64_t initWithUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                              const Value* identifier,
                                              std::uint64_t containerClass);

private:
    std::string identifier_;
    std::uint64_t containerClass_;
    QRNUserIdentityPtr userIdentity_;
};

} // namespace quarn
