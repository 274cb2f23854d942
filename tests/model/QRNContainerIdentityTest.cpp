#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <unordered_set>

using namespace quarn;

namespace {

class QRNContainerIdentityTest : public quarn::test::TempRootTest {
protected:
    QRNUserIdentityPtr user(std::uint32_t uid, std::uint32_t gid = 501) {
        return QRNUserIdentity::initWithUID(uid, gid, root_ / "/private/var/mobile", std::nullopt,
                                            kQRNPersonaTypePersonal, uid);
    }
    QRNContainerIdentityPtr identity(const QRNUserIdentityPtr& u, const std::string& id,
                                     std::uint64_t cls) {
        return *QRNContainerIdentity::containerIdentityWithUserIdentity(u, id, cls);
    }
    QRNContainerIdentityPtr concrete(const UUID& uuid, const QRNUserIdentityPtr& u,
                                     std::uint64_t cls = 2) {
        return *QRNConcreteContainerIdentity::containerIdentityWithUUID(uuid, u, "com.example.app",
                                                                        cls);
    }
    quarn::test::LogCapture log_;
};

} // namespace

// The checks run in a fixed order: the first failing one decides the code
// and the message. The UUID of a concrete identity is checked last.
TEST_F(QRNContainerIdentityTest, ChecksInOrderWithCodesAndMessages) {
    auto u = user(501);
    const Value str("com.example.app"), number(std::uint64_t{7}), none;
    const Value uuidString("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"), uuid(UUID::random());
    struct Case {
        bool concrete;
        const Value* uuid;
        QRNUserIdentityPtr user;
        const Value* identifier;
        std::uint64_t cls;
        std::uint64_t code;
        const char* logged; // null: "uuid" must not be mentioned
    };
    const Case cases[] = {
        {false, nullptr, nullptr, nullptr, 99, kQRNErrorInvalidArgument,
         "Invalid object: no user identity"},
        {false, nullptr, u, nullptr, 99, kQRNErrorMissingIdentifier,
         "Invalid object: missing identifier"},
        {false, nullptr, u, &none, 2, kQRNErrorMissingIdentifier,
         "Invalid object: missing identifier"},
        {false, nullptr, u, &number, 99, kQRNErrorInvalidArgument,
         "Invalid object: identifier = [7]"},
        {false, nullptr, u, &str, 0, kQRNErrorInvalidArgument,
         "Invalid object: container class = 0"},
        {false, nullptr, u, &str, 14, kQRNErrorInvalidArgument,
         "Invalid object: container class = 14"},
        {false, nullptr, u, &str, ~std::uint64_t{0}, kQRNErrorInvalidArgument,
         "Invalid object: container class = 18446744073709551615"},
        {true, &uuidString, u, nullptr, 2, kQRNErrorMissingIdentifier, nullptr},
        {true, &uuidString, u, &str, 2, kQRNErrorInvalidArgument, "Invalid object: uuid = ["},
        {true, nullptr, u, &str, 2, kQRNErrorInvalidArgument, "Invalid object: uuid = ["},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.logged ? c.logged : "uuid not checked");
        log_.clear();
        const auto failure = [&]() -> std::optional<std::uint64_t> {
            if (c.concrete) {
                auto r = QRNConcreteContainerIdentity::containerIdentityWithUUID(
                    c.uuid, c.user, c.identifier, c.cls);
                return r ? std::nullopt : std::optional(r.error());
            }
            auto r = QRNContainerIdentity::containerIdentityWithUserIdentity(c.user, c.identifier,
                                                                             c.cls);
            return r ? std::nullopt : std::optional(r.error());
        }();
        EXPECT_EQ(failure, c.code);
        EXPECT_EQ(log_.messages().size(), 1u) << log_.all();
        EXPECT_TRUE(c.logged ? log_.contains(c.logged) : !log_.contains("uuid")) << log_.all();
    }
    for (std::uint64_t cls = 1; cls <= 13; ++cls) {
        auto r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, &str, cls);
        ASSERT_TRUE(r) << cls;
        EXPECT_EQ((*r)->identifier(), "com.example.app");
        EXPECT_EQ((*r)->containerClass(), cls);
        EXPECT_TRUE((*r)->userIdentity()->isEqual(*u));
    }
    auto r = QRNConcreteContainerIdentity::containerIdentityWithUUID(&uuid, u, &str, 2);
    ASSERT_TRUE(r);
    EXPECT_EQ((*r)->uuid(), *uuid.asUUID());

    EXPECT_EQ(QRNContainerIdentity::init(), nullptr);
    EXPECT_EQ(QRNConcreteContainerIdentity::init(), nullptr);
    EXPECT_EQ(log_.count("You cannot init this class directly."), 2u);
}

// Only bundle and system classes may do without a caller-given user; they
// get the default identity.
TEST_F(QRNContainerIdentityTest, IdentifierOnlyNeedsAClassWithoutUser) {
    for (std::uint64_t cls = 0; cls <= 15; ++cls) {
        SCOPED_TRACE(cls);
        auto r = QRNContainerIdentity::containerIdentityWithIdentifier("com.example.x", cls);
        const bool allowed = cls == 1 || cls == 3 || cls == 5 || cls == 8 || cls == 12 || cls == 13;
        ASSERT_EQ(r.has_value(), allowed);
        if (allowed) {
            EXPECT_TRUE(
                (*r)->userIdentity()->isEqual(*QRNUserIdentitySharedCache::defaultUserIdentity()));
        } else {
            EXPECT_EQ(r.error(), kQRNErrorInvalidArgument);
        }
    }
    EXPECT_TRUE(log_.contains("Attempt to create a container identity without a user identity "
                              "when one is required; identifier = [com.example.x], class = 2"));
}

TEST_F(QRNContainerIdentityTest, EqualityFromBothSides) {
    auto u501 = user(501, 501);
    auto u501b = user(501, 20); // same identifier "501"
    auto a = identity(u501, "com.example.app", 2);
    const UUID uuid = UUID::random();
    auto c = concrete(uuid, u501b), c2 = concrete(uuid, u501),
         cOther = concrete(UUID::random(), u501);

    EXPECT_TRUE(a->isEqual(*identity(u501b, "com.example.app", 2)));
    EXPECT_FALSE(a->isEqual(*identity(u501, "com.example.app", 7)));
    EXPECT_FALSE(a->isEqual(*identity(user(502), "com.example.app", 2)));
    EXPECT_FALSE(a->isEqual(*identity(u501, "com.example.App", 2)));

    // The base side ignores the UUID; the concrete side needs a concrete
    // identity with the same UUID.
    EXPECT_TRUE(a->isEqual(*c) && a->isEqual(*cOther));
    EXPECT_FALSE(c->isEqual(*a));
    EXPECT_TRUE(c->isEqual(*c2) && c2->isEqual(*c));
    EXPECT_FALSE(c->isEqual(*cOther));

    // Equal identities hash alike, so they work as set members.
    EXPECT_EQ(c->hash(), c2->hash());
    std::unordered_set<QRNContainerIdentityPtr, QRNContainerIdentity::Hash,
                       QRNContainerIdentity::Equal>
        set{a, identity(u501, "com.example.app", 4), c, cOther};
    EXPECT_EQ(set.count(identity(u501, "com.example.app", 4)), 1u);
    EXPECT_EQ(set.count(concrete(uuid, u501)), 1u);
}
