#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/model/QRNWhitelist.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>
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
TEST_F(QRNContainerIdentityTest, ChecksInOrderWithCodesAndMessagesThenEquality) {
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
        const char* logged; // after "Invalid object: "; null: "uuid" not mentioned
    };
    const auto bad = kQRNErrorInvalidArgument, noId = kQRNErrorMissingIdentifier;
    const Case cases[] = {
        {false, nullptr, nullptr, nullptr, 99, bad, "no user identity"},
        {false, nullptr, u, nullptr, 99, noId, "missing identifier"},
        {false, nullptr, u, &none, 2, noId, "missing identifier"},
        {false, nullptr, u, &number, 99, bad, "identifier = [7]"},
        {false, nullptr, u, &str, 0, bad, "container class = 0"},
        {false, nullptr, u, &str, 14, bad, "container class = 14"},
        {false, nullptr, u, &str, ~std::uint64_t{0}, bad, "container class = 18446744073709551615"},
        {true, &uuidString, u, nullptr, 2, noId, nullptr},
        {true, &uuidString, u, &str, 2, bad, "uuid = ["},
        {true, nullptr, u, &str, 2, bad, "uuid = ["},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.logged ? c.logged : "uuid not checked");
        log_.clear();
        const auto code = [](const auto& r) { return r ? std::uint64_t{0} : r.error(); };
        EXPECT_EQ(c.concrete ? code(QRNConcreteContainerIdentity::containerIdentityWithUUID(
                                   c.uuid, c.user, c.identifier, c.cls))
                             : code(QRNContainerIdentity::containerIdentityWithUserIdentity(
                                   c.user, c.identifier, c.cls)),
                  c.code);
        EXPECT_EQ(log_.messages().size(), 1u) << log_.all();
        EXPECT_TRUE(c.logged ? log_.contains(std::string("Invalid object: ") + c.logged)
                             : !log_.contains("uuid"))
            << log_.all();
    }
    auto r = QRNConcreteContainerIdentity::containerIdentityWithUUID(&uuid, u, &str, 2);
    ASSERT_TRUE(r);
    EXPECT_EQ((*r)->uuid(), *uuid.asUUID());

    EXPECT_EQ(QRNContainerIdentity::init(), nullptr);
    EXPECT_EQ(QRNConcreteContainerIdentity::init(), nullptr);
    EXPECT_EQ(log_.count("You cannot init this class directly."), 2u);

    // Equality: the identifier, class and user decide.
    auto u501 = user(501, 501);
    auto u501b = user(501, 20); // same identifier "501"
    auto a = identity(u501, "com.example.app", 2);
    const UUID same = UUID::random();
    auto c = concrete(same, u501b), c2 = concrete(same, u501),
         cOther = concrete(UUID::random(), u501);

    EXPECT_TRUE(a->isEqual(*identity(u501b, "com.example.app", 2)));
    EXPECT_FALSE(a->isEqual(*identity(u501, "com.example.app", 7)));
    EXPECT_FALSE(a->isEqual(*identity(user(502), "com.example.app", 2)));
    EXPECT_FALSE(a->isEqual(*identity(u501, "com.example.App", 2)));

    // The base side ignores the UUID; the concrete side needs a concrete
    // identity with the same UUID.
    EXPECT_TRUE(a->isEqual(*c) && a->isEqual(*cOther));
    EXPECT_FALSE(c->isEqual(*a));
    EXPECT_TRUE(c->isEqual(*c) && c->isEqual(*c2) && c2->isEqual(*c));
    EXPECT_FALSE(c->isEqual(*cOther));

    // Equal identities hash alike, so they work as set members.
    EXPECT_EQ(c->hash(), c2->hash());
    std::unordered_set<QRNContainerIdentityPtr, QRNContainerIdentity::Hash,
                       QRNContainerIdentity::Equal>
        set{a, identity(u501, "com.example.app", 4), c, cOther};
    EXPECT_EQ(set.count(identity(u501, "com.example.app", 4)), 1u);
    EXPECT_EQ(set.count(concrete(same, u501)), 1u);
}

// Each predicate over 0..15 (and a few large numbers) against the class sets
// the rest of the daemon relies on. Only bundle and system classes may do
// without a caller-given user (they get the default identity) and have fixed
// owners: the installer (also as group) for bundles, root for system ones.
TEST_F(QRNContainerIdentityTest, ClassSetsPredicatesAndOwners) {
    using Set = std::set<std::uint64_t>;
    using TB = QRNContainerClass::TransientBase;
    const Set bundle{1, 3, 5, 8}, system{12, 13}, group{7, 13}, perUser{2, 4, 6, 7, 9, 10, 11},
        transient{2, 4, 6, 7, 12, 13};
    auto u = user(600, 700);
    std::set<std::string> seenDirs, seenNames;
    for (std::uint64_t c = 0; c <= 15; ++c) {
        SCOPED_TRACE(c);
        const bool isBundle = bundle.count(c), isSystem = system.count(c);
        EXPECT_EQ(QRNContainerClass::isValid(c), c >= 1 && c <= 13);
        EXPECT_EQ(QRNContainerIdentity::containerIdentityWithUserIdentity(u, "x", c).has_value(),
                  c >= 1 && c <= 13);
        // Each valid class its own directory (two components, appended to a
        // base, the first saying what kind of class it is) and name.
        if (c >= 1 && c <= 13) {
            const std::filesystem::path dir(QRNContainerClass::relativeDirectory(c));
            EXPECT_TRUE(seenDirs.insert(dir.string()).second);
            EXPECT_TRUE(seenNames.insert(std::string(QRNContainerClass::shortName(c))).second);
            EXPECT_EQ(std::distance(dir.begin(), dir.end()), 2);
            EXPECT_EQ(dir.begin()->string(), isBundle         ? "Bundle"
                                             : group.count(c) ? "Shared"
                                                              : "Data");
        }
        EXPECT_EQ(QRNContainerClass::isBundle(c), isBundle);
        EXPECT_EQ(QRNContainerClass::isSystem(c), isSystem);
        EXPECT_EQ(QRNContainerClass::isGlobal(c), isBundle || isSystem);
        EXPECT_EQ(QRNContainerClass::isGroup(c), group.count(c) != 0);
        EXPECT_EQ(QRNContainerClass::usesPerUserStaging(c), perUser.count(c) != 0);
        EXPECT_EQ(QRNContainerClass::isPerUser(c), perUser.count(c) != 0);
        EXPECT_EQ(QRNContainerClass::baseDirectoryOwner(c), isBundle ? 33u : 0u);
        EXPECT_EQ(QRNContainerClass::transientBase(c), isBundle             ? TB::TransientBundle
                                                       : transient.count(c) ? TB::Transient
                                                                            : TB::None);
        EXPECT_EQ(u->posixUIDForContainerClass(c), isBundle ? 33u : isSystem ? 0u : 600u);
        EXPECT_EQ(u->posixGIDForContainerClass(c), isBundle ? 33u : isSystem ? 0u : 700u);
        // Required for everything else, invalid numbers included: those are
        // refused later by the range check.
        EXPECT_EQ(QRNContainerClass::isUserIdentityRequired(c), !isBundle && !isSystem);
        auto r = QRNContainerIdentity::containerIdentityWithIdentifier("com.example.x", c);
        ASSERT_EQ(r.has_value(), isBundle || isSystem);
        EXPECT_TRUE(
            r ? (*r)->userIdentity()->isEqual(*QRNUserIdentitySharedCache::defaultUserIdentity())
              : r.error() == kQRNErrorInvalidArgument);
    }
    EXPECT_TRUE(log_.contains("Attempt to create a container identity without a user identity "
                              "when one is required; identifier = [com.example.x], class = 2"));
    EXPECT_EQ(QRNContainerClass::relativeDirectory(15), "");
    EXPECT_EQ(QRNContainerClass::shortName(14), "");
    for (std::uint64_t c : {std::uint64_t{64}, std::uint64_t{0x12a}, ~std::uint64_t{0}}) {
        EXPECT_FALSE(QRNContainerClass::isValid(c) || QRNContainerClass::isBundle(c) ||
                     QRNContainerClass::isSystem(c) || QRNContainerClass::usesPerUserStaging(c) ||
                     !QRNContainerClass::isUserIdentityRequired(c))
            << c;
    }
}

// Well-known containers are named by identifier in their own class only.
TEST(QRNWhitelist, WellknownContainersAreNamedByIdentifierInTheirOwnClassOnly) {
    test::TempRoot root;
    const QRNWhitelist& whitelist = QRNWhitelist::sharedWhitelist();
    for (const auto& group : whitelist.wellknownSystemGroupContainers()) {
        EXPECT_EQ(whitelist.wellknownContainerForId(group, 13), group);
        EXPECT_FALSE(whitelist.containerIdIsWellknown(group, 12)) << group;
    }
    EXPECT_EQ(whitelist.wellknownContainerForId("com.orvex.accountsd", 12), "com.orvex.accountsd");
    EXPECT_FALSE(whitelist.containerIdIsWellknown("com.orvex.accountsd", 13));
    EXPECT_FALSE(whitelist.systemContainerIdIsWellknown("com.orvex.accountsd2"));
}

// One row per rule: null markers for a client or a class, identifier sets,
// and the open set that comes before any client's entries.
TEST(QRNWhitelist, LookupExceptionsFollowNullMarkersSetsAndOpenSets) {
    const std::tuple<const char*, std::uint64_t, const char*, bool> cases[] = {
        {"com.orvex.backupd", 13, "any", true},
        {"com.orvex.backupd", 14, "any", false},
        {"com.orvex.settings", 7, "any", true},
        {"com.orvex.settings", 12, "any", false},
        {"com.orvex.searchd", 2, "com.orvex.mail", true},
        {"com.orvex.searchd", 2, "com.orvex.photos", false},
        {"com.orvex.searchd", 4, "com.orvex.notes", false},
        {"com.unknown.app", 13, "systemgroup.com.orvex.diagnostics", true},
        {"com.orvex.pairingd", 13, "systemgroup.com.orvex.diagnostics", true},
        {"com.unknown.app", 12, "systemgroup.com.orvex.diagnostics", false},
        {"com.unknown.app", 13, "systemgroup.com.orvex.telemetry", false},
    };
    QRNWhitelist whitelist;
    for (const auto& [client, cls, container, allowed] : cases) {
        EXPECT_EQ(whitelist.isLookupWhitelistedFromCodeSignIdentifier(client, cls, container),
                  allowed)
            << client << " class " << cls << " " << container;
    }
}
