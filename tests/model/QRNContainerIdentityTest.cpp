#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <unordered_set>

using namespace quarn;
using quarn::test::LogCapture;

namespace {

class QRNContainerIdentityTest : public quarn::test::TempRootTest {
protected:
    QRNUserIdentityPtr user(std::uint32_t uid, std::uint32_t gid = 501) {
        return QRNUserIdentity::initWithUID(uid, gid, root_ / "/private/var/mobile", std::nullopt,
                                            kQRNPersonaTypePersonal, uid);
    }
    QRNContainerIdentityPtr identity(const QRNUserIdentityPtr& u, const std::string& id,
                                     std::uint64_t cls) {
        auto r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, id, cls);
        EXPECT_TRUE(r) << id << " " << cls;
        return r ? *r : nullptr;
    }
    QRNConcreteContainerIdentityPtr concrete(const UUID& uuid, const QRNUserIdentityPtr& u,
                                             const std::string& id, std::uint64_t cls) {
        auto r = QRNConcreteContainerIdentity::containerIdentityWithUUID(uuid, u, id, cls);
        EXPECT_TRUE(r);
        return r ? *r : nullptr;
    }
};

} // namespace

// The checks run in a fixed order: the first failing one decides the code
// and the message.
TEST_F(QRNContainerIdentityTest, ChecksInOrderWithCodesAndMessages) {
    LogCapture log;
    auto u = user(501);
    const Value str("com.example.app");
    const Value number(std::uint64_t{7});

    auto r = QRNContainerIdentity::containerIdentityWithUserIdentity(nullptr, nullptr, 99);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorInvalidArgument);
    EXPECT_TRUE(log.contains("Invalid object: no user identity"));

    r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, nullptr, 99);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorMissingIdentifier);
    EXPECT_TRUE(log.contains("Invalid object: missing identifier"));

    const Value none;
    r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, &none, 2);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorMissingIdentifier);

    r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, &number, 99);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorInvalidArgument);
    EXPECT_TRUE(log.contains("Invalid object: identifier = [7]")) << log.all();
    EXPECT_FALSE(log.contains("container class"));

    for (std::uint64_t cls :
         {std::uint64_t{0}, std::uint64_t{14}, std::uint64_t{15}, ~std::uint64_t{0}}) {
        log.clear();
        r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, &str, cls);
        ASSERT_FALSE(r);
        EXPECT_EQ(r.error(), kQRNErrorInvalidArgument);
        EXPECT_TRUE(log.contains(fmt::format("Invalid object: container class = {}", cls)));
    }
    for (std::uint64_t cls = 1; cls <= 13; ++cls) {
        r = QRNContainerIdentity::containerIdentityWithUserIdentity(u, &str, cls);
        ASSERT_TRUE(r) << cls;
        EXPECT_EQ((*r)->identifier(), "com.example.app");
        EXPECT_EQ((*r)->containerClass(), cls);
        EXPECT_TRUE((*r)->userIdentity()->isEqual(*u));
    }
}

// The UUID is checked only after every base check has passed.
TEST_F(QRNContainerIdentityTest, ConcreteChecksUUIDAfterBaseChecks) {
    LogCapture log;
    auto u = user(501);
    const Value id("com.example.app");
    const Value uuidString("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
    const Value uuid(UUID::random());

    auto r = QRNConcreteContainerIdentity::containerIdentityWithUUID(&uuidString, u, nullptr, 2);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorMissingIdentifier);
    EXPECT_FALSE(log.contains("uuid"));

    r = QRNConcreteContainerIdentity::containerIdentityWithUUID(&uuidString, u, &id, 2);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorInvalidArgument);
    EXPECT_TRUE(log.contains("Invalid object: uuid = [")) << log.all();

    r = QRNConcreteContainerIdentity::containerIdentityWithUUID(nullptr, u, &id, 2);
    ASSERT_FALSE(r);
    EXPECT_EQ(r.error(), kQRNErrorInvalidArgument);

    r = QRNConcreteContainerIdentity::containerIdentityWithUUID(&uuid, u, &id, 2);
    ASSERT_TRUE(r);
    EXPECT_EQ((*r)->uuid(), *uuid.asUUID());
}

TEST_F(QRNContainerIdentityTest, PlainInitIsRefused) {
    LogCapture log;
    EXPECT_EQ(QRNContainerIdentity::init(), nullptr);
    EXPECT_EQ(QRNConcreteContainerIdentity::init(), nullptr);
    EXPECT_EQ(log.count("You cannot init this class directly."), 2u);
}

// Only bundle and system classes may do without a caller-given user; they
// get the default identity.
TEST_F(QRNContainerIdentityTest, IdentifierOnlyNeedsAClassWithoutUser) {
    LogCapture log;
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
    EXPECT_TRUE(log.contains("Attempt to create a container identity without a user identity "
                             "when one is required; identifier = [com.example.x], class = 2"));
}

TEST_F(QRNContainerIdentityTest, EqualityFromBothSides) {
    auto u501 = user(501, 501);
    auto u501b = user(501, 20); // same identifier "501"
    auto u502 = user(502);
    auto a = identity(u501, "com.example.app", 2);
    const UUID uuid = UUID::random();
    auto c = concrete(uuid, u501b, "com.example.app", 2);
    auto c2 = concrete(uuid, u501, "com.example.app", 2);
    auto cOther = concrete(UUID::random(), u501, "com.example.app", 2);

    EXPECT_TRUE(a->isEqual(*identity(u501b, "com.example.app", 2)));
    EXPECT_FALSE(a->isEqual(*identity(u501, "com.example.app", 7)));
    EXPECT_FALSE(a->isEqual(*identity(u502, "com.example.app", 2)));
    EXPECT_FALSE(a->isEqual(*identity(u501, "com.example.App", 2)));

    // The base side ignores the UUID; the concrete side needs a concrete
    // identity with the same UUID.
    EXPECT_TRUE(a->isEqual(*c));
    EXPECT_FALSE(c->isEqual(*a));
    EXPECT_TRUE(c->isEqual(*c2));
    EXPECT_TRUE(c2->isEqual(*c));
    EXPECT_FALSE(c->isEqual(*cOther));
    EXPECT_TRUE(a->isEqual(*cOther));
    EXPECT_TRUE(c->isEqual(*c));

    // Equal identities hash alike, so they work as set members.
    EXPECT_EQ(c->hash(), c2->hash());
    std::unordered_set<QRNContainerIdentityPtr, QRNContainerIdentity::Hash,
                       QRNContainerIdentity::Equal>
        set{a,
            identity(u501b, "com.example.app", 2),
            identity(u501, "com.example.app", 4),
            c,
            c2,
            cOther};
    EXPECT_EQ(set.count(identity(u501, "com.example.app", 4)), 1u);
    EXPECT_EQ(set.count(concrete(uuid, u501, "com.example.app", 2)), 1u);
}

TEST_F(QRNContainerIdentityTest, Descriptions) {
    auto u = user(501);
    auto a = identity(u, "com.example.app", 2);
    const auto uuid = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
    auto c = concrete(uuid, u, "com.example.app", 7);
    EXPECT_EQ(a->description(),
              fmt::format("<QRNContainerIdentity: {}; userIdentity = {}, identifier = "
                          "com.example.app, class = 2>",
                          fmt::ptr(a.get()), u->shortDescription()));
    EXPECT_EQ(c->description(),
              fmt::format("<QRNConcreteContainerIdentity: {}; userIdentity = {}, identifier = "
                          "com.example.app, class = 7, uuid = {}>",
                          fmt::ptr(c.get()), u->shortDescription(), uuid.string()));
}
