#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/model/QRNUserIdentityCache.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>

using namespace quarn;
using quarn::test::LogCapture;

namespace {

struct RecordingObserver : QRNUserIdentityCacheObserver {
    void userIdentityCache(QRNUserIdentityCache&, const QRNUserIdentityPtr& identity) override {
        std::lock_guard guard(mutex);
        ++seen[identity->identifier()];
        ++total;
        changed.notify_all();
    }
    // Waits (bounded, generously) until `count` notifications arrived.
    bool waitFor(std::size_t count) {
        std::unique_lock guard(mutex);
        return changed.wait_for(guard, std::chrono::seconds(30), [&] { return total >= count; });
    }
    std::mutex mutex; // guards seen and total
    std::condition_variable changed;
    std::map<std::string, int> seen;
    std::size_t total = 0;
};

class QRNUserIdentityTest : public quarn::test::TempRootTest {
protected:
    std::filesystem::path home() const { return root_ / "/private/var/mobile"; }
    QRNUserIdentityPtr make(std::uint32_t uid, std::uint32_t gid, std::int32_t type = 0,
                            std::optional<std::string> persona = std::nullopt,
                            std::uint32_t kernelPersonaID = 1000,
                            const char* homeDirectory = "/private/var/mobile") {
        return QRNUserIdentity::initWithUID(uid, gid, root_ / homeDirectory, std::move(persona),
                                            type, kernelPersonaID);
    }
    // A personal, two enterprise and an unspecific persona of user 501.
    std::vector<QRNUserIdentityPtr> personas() {
        return {make(501, 501, kQRNPersonaTypePersonal, "personal", 1000, "/private/var/p"),
                make(501, 501, kQRNPersonaTypeEnterprise, "ent-1", 1001, "/private/var/ent1"),
                make(501, 501, kQRNPersonaTypeEnterprise, "ent-2", 1002, "/private/var/ent2"),
                make(501, 501, kQRNPersonaTypeUnspecific, "unspecific", 1003, "/private/var/p")};
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

// Role uids get no identity; the identifier is the persona string only for
// enterprise personas; the default and every copy keep kernel persona 501.
TEST_F(QRNUserIdentityTest, IdentityValuesAndUIDSubstitution) {
    LogCapture log;
    EXPECT_EQ(make(500, 20), nullptr);
    EXPECT_TRUE(log.contains("Attempt to create a QRNUserIdentity object with a role user uid is "
                             "not allowed: uid = 500, gid = 20"));

    EXPECT_EQ(make(501, 501, kQRNPersonaTypeEnterprise, "ENT-1")->identifier(), "ENT-1");
    EXPECT_EQ(make(501, 501, kQRNPersonaTypePersonal, "P-1")->identifier(), "501");
    EXPECT_EQ(make(777, 501, kQRNPersonaTypeEnterprise)->identifier(), "777");
    // Equality and hash follow the identifier alone.
    auto a = make(501, 501, 0, std::nullopt, 1);
    auto b = make(501, 20, 2, "X", 2);
    EXPECT_TRUE(a->isEqual(*b));
    EXPECT_EQ(a->hash(), b->hash());
    EXPECT_FALSE(a->isEqual(*make(502, 501)));

    auto legacy = QRNUserIdentity::init();
    ASSERT_NE(legacy, nullptr);
    EXPECT_EQ(legacy->kernelPersonaID(), 501u);
    EXPECT_EQ(legacy->homeDirectoryURL(), std::filesystem::canonical(home()));
    auto ent = make(900, 901, kQRNPersonaTypeEnterprise, "ENT", 4242);
    auto copy = ent->copy();
    EXPECT_EQ(copy->kernelPersonaID(), 501u);
    EXPECT_TRUE(copy->isEqual(*ent)); // the persona string kept

    // Role uids are answered for the mobile user, other uids get an identity
    // derived from the personal one.
    auto& cache = this->cache();
    auto def = cache.defaultUserIdentity();
    ASSERT_NE(def, nullptr);
    EXPECT_EQ(def->posixUID(), 501u);
    EXPECT_EQ(QRNUserIdentitySharedCache::defaultUserIdentity(), def); // built once

    for (std::uint32_t uid : {0u, 33u, 500u}) {
        EXPECT_EQ(cache.userIdentityForPersonalPersonaWithUID(uid, 7), def) << uid;
        EXPECT_EQ(cache.userIdentityForPersonaUniqueString("any", uid, 7), def) << uid;
    }
    auto other = cache.userIdentityForPersonalPersonaWithUID(600, 601);
    ASSERT_NE(other, nullptr);
    EXPECT_EQ(other->identifier(), "600");
    // uid 600 has no account: its home falls back to the mobile home.
    EXPECT_EQ(other->homeDirectoryURL(), root_ / "/private/var/mobile");

    EXPECT_EQ(cache.userIdentityForCurrentContextWithUID(0, 0), def);

    int calls = 0;
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const QRNUserIdentityPtr& u) {
        ++calls;
        EXPECT_EQ(u, def);
    });
    EXPECT_EQ(calls, 1);
}

TEST_F(QRNUserIdentityTest, PlistHasFourEntriesReadsBackInEitherVersionAndRefusesBadInput) {
    LogCapture log;
    auto u = make(501, 501, kQRNPersonaTypeEnterprise, "ENT", 7);
    Value plist = u->plist();
    EXPECT_EQ(plist,
              dict({{"posixUID", 501u}, {"posixGID", 501u}, {"type", 1u}, {"version", "2"}}));
    // Without the persona string the stored enterprise identity reads back
    // as the personal one for its uid.
    auto back = read(plist);
    ASSERT_TRUE(back && *back);
    EXPECT_EQ((*back)->identifier(), "501");

    auto r = read(make(777, 778)->plist());
    ASSERT_TRUE(r);
    EXPECT_EQ((*r)->posixUID(), 777u);
    EXPECT_EQ((*r)->posixGID(), 778u);

    // Version 1 with a persona entry: the cache is asked by persona and,
    // answering for the personal persona here, gives the stored ids.
    r = read(dict(
        {{"posixUID", 640u}, {"posixGID", 641u}, {"personaIdentifier", "P"}, {"version", "1"}}));
    ASSERT_TRUE(r && *r);
    EXPECT_EQ((*r)->posixGID(), 641u);
    EXPECT_EQ((*r)->identifier(), "640");

    // A stored role uid is answered for the mobile user.
    r = read(dict({{"posixUID", 0u}, {"posixGID", 0u}, {"version", "1"}}));
    ASSERT_TRUE(r);
    EXPECT_EQ((*r)->posixUID(), 501u);

    // Malformed stored identities are refused with code 75; unknown versions and
    // non-dictionaries give no identity and no code.
    const Value gid{501u}, v1{"1"}, v2{"2"};
    const std::pair<Value, const char*> refused[] = {
        {dict({{"posixUID", "501"}, {"posixGID", gid}, {"type", 0u}, {"version", v2}}),
         "Invalid user identity plist data. Expected number for posixUID, got string. Data:"},
        {dict({{"posixUID", 501u}, {"type", 0u}, {"version", v2}}),
         "Expected number for posixGID, got nil"},
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
          dict({{"posixUID", 501u}, {"posixGID", gid}}), Value(Value::Array{})}) {
        auto r = read(noIdentity);
        ASSERT_TRUE(r) << noIdentity.description();
        EXPECT_EQ(*r, nullptr) << noIdentity.description();
    }
}

// One cache through repopulations and flushes: which identities it chooses,
// lookups by persona, and observers (held weakly) hearing once of every
// enterprise identity a flush drops.
TEST_F(QRNUserIdentityTest, PersonaCacheRepopulatesLooksUpAndFlushes) {
    QRNUserIdentityCache cache(root_.context(), true);
    auto seen = std::make_shared<RecordingObserver>();
    auto removed = std::make_shared<RecordingObserver>();
    auto gone = std::make_shared<RecordingObserver>();
    for (const auto& o : {seen, removed, gone}) {
        cache.addObserver(o);
    }
    cache.removeObserver(removed);
    std::weak_ptr<RecordingObserver> goneWeak = gone;
    gone.reset();
    EXPECT_TRUE(goneWeak.expired());

    auto list = personas();
    cache.flushAndRepopulateWithUserIdentities(list);
    EXPECT_TRUE(seen->seen.empty()); // repopulating drops nothing by itself
    EXPECT_EQ(cache.userIdentityForPersonalPersona(), list[0]);
    EXPECT_EQ(cache.userIdentityWithPersonaID(1001), list[1]);
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString("ent-1", 501, 501), list[1]);
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString(std::nullopt, 0, 0), list[3]);
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString("nobody", 501, 501), nullptr);
    // Other ids: an updated copy; an enterprise persona keeps its own home,
    // the others move to the uid's home.
    auto moved = cache.userIdentityForPersonaUniqueString("ent-2", 650, 651);
    EXPECT_EQ(moved->posixGID(), 651u);
    EXPECT_EQ(moved->homeDirectoryURL(), root_ / "/private/var/ent2");
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString("personal", 650, 651)->homeDirectoryURL(),
              root_ / "/private/var/mobile");

    // A stored persona string must name an enterprise identity.
    Value stored = list[2]->plist();
    for (const auto& [persona, expected] :
         {std::pair{"ent-2", list[2]}, {"personal", list[0]}, {"gone", QRNUserIdentityPtr()}}) {
        stored.set("personaUniqueString", persona);
        auto read = QRNUserIdentity::userIdentityWithPlist(stored, cache);
        ASSERT_TRUE(read) << persona;
        EXPECT_EQ(*read, expected) << persona;
    }

    std::size_t visited = 0;
    const auto visit = [&](const QRNUserIdentityPtr&) { ++visited; };
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(visit);
    EXPECT_EQ(visited, list.size());
    cache.flush();
    cache.flush();
    EXPECT_EQ(seen->seen, (std::map<std::string, int>{{"ent-1", 1}, {"ent-2", 1}}));
    EXPECT_TRUE(removed->seen.empty());
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(visit);
    EXPECT_EQ(visited, list.size());
    EXPECT_EQ(cache.unspecificUserIdentity(), cache.defaultUserIdentity());

    // Without an unspecific persona one is made from the personal one; the
    // last personal persona of the list wins.
    auto later = make(501, 501, kQRNPersonaTypePersonal, "personal-2", 2000, "/private/var/p2");
    cache.flushAndRepopulateWithUserIdentities({list[0], list[1], later});
    EXPECT_EQ(cache.userIdentityForPersonalPersona(), later);
    auto unspecific = cache.unspecificUserIdentity();
    EXPECT_TRUE(unspecific->isNoSpecificPersona());
    EXPECT_EQ(unspecific->kernelPersonaID(), 2000u);

    // A persona list update flushes in the background; observers hear of
    // the dropped enterprise identity from the flush queue.
    cache.personaListDidUpdate();
    ASSERT_TRUE(seen->waitFor(3));
    EXPECT_EQ(cache.userIdentityWithPersonaID(1001), nullptr);
    std::lock_guard guard(seen->mutex);
    EXPECT_EQ(seen->seen, (std::map<std::string, int>{{"ent-1", 2}, {"ent-2", 1}}));
}
