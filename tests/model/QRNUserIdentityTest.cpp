#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/model/QRNUserIdentityCache.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;
using quarn::test::LogCapture;

namespace {

class QRNUserIdentityTest : public quarn::test::TempRootTest {
protected:
    std::filesystem::path home() const { return root_ / "/private/var/mobile"; }
    QRNUserIdentityPtr make(std::uint32_t uid, std::uint32_t gid, std::int32_t type = 0,
                            std::optional<std::string> persona = std::nullopt,
                            std::uint32_t kernelPersonaID = 1000) {
        return QRNUserIdentity::initWithUID(uid, gid, home(), std::move(persona), type,
                                            kernelPersonaID);
    }
    QRNUserIdentityCache& cache() { return QRNUserIdentitySharedCache::sharedCache(); }
    CodeResult<QRNUserIdentityPtr> read(const Value& plist) {
        return QRNUserIdentity::userIdentityWithPlist(plist, cache());
    }
    static Value dict(std::initializer_list<std::pair<const char*, Value>> entries) {
        Value d = Value::dictionary();
        for (const auto& [k, v] : entries) {
            d.set(k, v);
        }
        return d;
    }
};

} // namespace

TEST_F(QRNUserIdentityTest, RoleUIDsAreRefused) {
    LogCapture log;
    EXPECT_EQ(make(0, 0), nullptr);
    EXPECT_EQ(make(500, 20), nullptr);
    EXPECT_TRUE(log.contains("Attempt to create a QRNUserIdentity object with a role user uid is "
                             "not allowed: uid = 500, gid = 20"));
    ASSERT_NE(make(501, 501), nullptr);
}

TEST_F(QRNUserIdentityTest, IdentifierIsPersonaOnlyForEnterprise) {
    EXPECT_EQ(make(501, 501, kQRNPersonaTypeEnterprise, "ENT-1")->identifier(), "ENT-1");
    EXPECT_EQ(make(501, 501, kQRNPersonaTypePersonal, "P-1")->identifier(), "501");
    EXPECT_EQ(make(4294967295u, 501, kQRNPersonaTypeUnspecific, "U-1")->identifier(), "4294967295");
    EXPECT_EQ(make(777, 501, kQRNPersonaTypeEnterprise)->identifier(), "777");

    // Equality and hash follow the identifier alone.
    auto a = make(501, 501, 0, std::nullopt, 1);
    auto b = make(501, 20, 2, "X", 2);
    EXPECT_TRUE(a->isEqual(*b));
    EXPECT_EQ(a->hash(), b->hash());
    EXPECT_FALSE(a->isEqual(*make(502, 501)));
    EXPECT_FALSE(a->isEqual(*make(501, 501, kQRNPersonaTypeEnterprise, "501x")));
}

// Bundle and system containers have fixed owners; the group of a bundle
// container is the installation uid, not a group of the user.
TEST_F(QRNUserIdentityTest, OwnerPerClass) {
    auto u = make(600, 700);
    for (std::uint64_t cls = 0; cls <= 15; ++cls) {
        const bool bundle = cls == 1 || cls == 3 || cls == 5 || cls == 8;
        const bool system = cls == 12 || cls == 13;
        EXPECT_EQ(u->posixUIDForContainerClass(cls), bundle ? 33u : system ? 0u : 600u) << cls;
        EXPECT_EQ(u->posixGIDForContainerClass(cls), bundle ? 33u : system ? 0u : 700u) << cls;
    }
}

TEST_F(QRNUserIdentityTest, DefaultAndCopyKeepKernelPersona501) {
    auto def = QRNUserIdentity::init();
    ASSERT_NE(def, nullptr);
    EXPECT_EQ(def->posixUID(), 501u);
    EXPECT_EQ(def->posixGID(), 501u);
    EXPECT_EQ(def->kernelPersonaID(), 501u);
    EXPECT_EQ(def->personaType(), kQRNPersonaTypePersonal);
    EXPECT_EQ(def->homeDirectoryURL(), std::filesystem::canonical(home()));

    auto ent = make(900, 901, kQRNPersonaTypeEnterprise, "ENT", 4242);
    auto copy = ent->copy();
    EXPECT_EQ(copy->kernelPersonaID(), 501u);
    EXPECT_EQ(copy->posixUID(), 900u);
    EXPECT_EQ(copy->posixGID(), 901u);
    EXPECT_EQ(copy->personaUniqueString(), std::optional<std::string>("ENT"));
    EXPECT_EQ(copy->personaType(), kQRNPersonaTypeEnterprise);
    EXPECT_EQ(copy->homeDirectoryURL(), home());
    EXPECT_TRUE(copy->isEqual(*ent));
}

TEST_F(QRNUserIdentityTest, PlistHasExactlyFourEntriesAndReadsBack) {
    auto u = make(501, 501, kQRNPersonaTypeEnterprise, "ENT", 7);
    Value plist = u->plist();
    EXPECT_EQ(plist,
              dict({{"posixUID", 501u}, {"posixGID", 501u}, {"type", 1u}, {"version", "2"}}));
    // Without the persona string the stored enterprise identity reads back
    // as the personal one for its uid.
    auto back = read(plist);
    ASSERT_TRUE(back);
    ASSERT_NE(*back, nullptr);
    EXPECT_EQ((*back)->identifier(), "501");

    auto other = read(make(777, 778)->plist());
    ASSERT_TRUE(other);
    EXPECT_EQ((*other)->posixUID(), 777u);
    EXPECT_EQ((*other)->posixGID(), 778u);
}

// Malformed stored identities are refused with code 75; unknown versions and
// non-dictionaries give no identity and no code.
TEST_F(QRNUserIdentityTest, PlistReadersRefuseBadInput) {
    LogCapture log;
    const Value gid{501u}, v1{"1"}, v2{"2"};
    const std::pair<Value, const char*> refused[] = {
        {dict({{"posixUID", "501"}, {"posixGID", gid}, {"type", 0u}, {"version", v2}}),
         "Invalid user identity plist data. Expected number for posixUID, got string. Data:"},
        {dict({{"posixUID", 501u}, {"type", 0u}, {"version", v2}}),
         "Expected number for posixGID, got nil"},
        {dict({{"posixUID", 501u}, {"posixGID", gid}, {"version", v2}}), "type"},
        {dict({{"posixUID", 501u}, {"posixGID", gid}, {"type", true}, {"version", v2}}), "type"},
        {dict({{"posixUID", 501u}, {"posixGID", gid}, {"type", 3u}, {"version", v2}}),
         "Invalid user identity plist data. Expected persona type for type, got 3. Data:"},
        {dict({{"posixUID", -1}, {"posixGID", gid}, {"version", v1}}), "posixUID"},
        {dict({{"posixUID", 501u}, {"posixGID", 1.5}, {"version", v1}}), "posixGID"},
        {dict({{"posixUID", std::uint64_t{1} << 32}, {"posixGID", gid}, {"version", v1}}),
         "posixUID"},
    };
    for (const auto& [plist, message] : refused) {
        SCOPED_TRACE(plist.description());
        log.clear();
        auto r = read(plist);
        ASSERT_FALSE(r);
        EXPECT_EQ(r.error(), kQRNErrorInvalidUserIdentityPlist);
        EXPECT_TRUE(log.contains(message)) << log.all();
    }
    for (const Value& noIdentity :
         {dict({{"posixUID", 501u}, {"posixGID", gid}, {"type", 0u}, {"version", "3"}}),
          dict({{"posixUID", 501u}, {"posixGID", gid}, {"type", 0u}, {"version", 2u}}),
          dict({{"posixUID", 501u}, {"posixGID", gid}}), Value(Value::Array{}), Value("2")}) {
        auto r = read(noIdentity);
        ASSERT_TRUE(r) << noIdentity.description();
        EXPECT_EQ(*r, nullptr) << noIdentity.description();
    }
}

TEST_F(QRNUserIdentityTest, Version1ReadsThroughTheCache) {
    // With a persona entry, the cache is asked by persona and, answering for
    // the personal persona here, gives the identity for the stored ids.
    auto r = read(dict(
        {{"posixUID", 640u}, {"posixGID", 641u}, {"personaIdentifier", "P"}, {"version", "1"}}));
    ASSERT_TRUE(r);
    ASSERT_NE(*r, nullptr);
    EXPECT_EQ((*r)->posixUID(), 640u);
    EXPECT_EQ((*r)->posixGID(), 641u);
    EXPECT_EQ((*r)->identifier(), "640");

    // A stored role uid is answered for the mobile user.
    r = read(dict({{"posixUID", 0u}, {"posixGID", 0u}, {"version", "1"}}));
    ASSERT_TRUE(r);
    EXPECT_EQ((*r)->posixUID(), 501u);
}
