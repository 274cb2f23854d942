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

class QRNUserIdentityCacheTest : public quarn::test::TempRootTest {
protected:
    QRNUserIdentityPtr make(std::uint32_t uid, std::int32_t type,
                            std::optional<std::string> persona, std::uint32_t kernelPersonaID,
                            const char* home = "/private/var/p") {
        return QRNUserIdentity::initWithUID(uid, uid, root_ / home, std::move(persona), type,
                                            kernelPersonaID);
    }
    // A personal, two enterprise and an unspecific persona of user 501.
    std::vector<QRNUserIdentityPtr> personas() {
        return {make(501, kQRNPersonaTypePersonal, "personal", 1000),
                make(501, kQRNPersonaTypeEnterprise, "ent-1", 1001, "/private/var/ent1"),
                make(501, kQRNPersonaTypeEnterprise, "ent-2", 1002, "/private/var/ent2"),
                make(501, kQRNPersonaTypeUnspecific, "unspecific", 1003)};
    }
    QRNUserIdentityCache& shared() { return QRNUserIdentitySharedCache::sharedCache(); }
};

} // namespace

// Role uids are answered for the mobile user, other uids get an identity
// derived from the personal one.
TEST_F(QRNUserIdentityCacheTest, UIDSubstitutionAndUpdate) {
    LogCapture log;
    auto& cache = shared();
    auto def = cache.defaultUserIdentity();
    ASSERT_NE(def, nullptr);
    EXPECT_EQ(def->posixUID(), 501u);
    EXPECT_EQ(def->kernelPersonaID(), 501u);
    EXPECT_EQ(cache.defaultUserIdentity(), def); // built once
    EXPECT_EQ(QRNUserIdentitySharedCache::defaultUserIdentity(), def);

    for (std::uint32_t uid : {0u, 33u, 500u}) {
        EXPECT_EQ(cache.userIdentityForPersonalPersonaWithUID(uid, 7), def) << uid;
        EXPECT_EQ(cache.userIdentityForPersonaUniqueString("any", uid, 7), def) << uid;
    }
    auto other = cache.userIdentityForPersonalPersonaWithUID(600, 601);
    ASSERT_NE(other, nullptr);
    EXPECT_EQ(other->posixUID(), 600u);
    EXPECT_EQ(other->posixGID(), 601u);
    EXPECT_EQ(other->kernelPersonaID(), 501u);
    // uid 600 has no account: its home falls back to the mobile home.
    EXPECT_EQ(other->homeDirectoryURL(), root_ / "/private/var/mobile");

    auto current = cache.userIdentityForCurrentContextWithUID(0, 0);
    EXPECT_EQ(current, def);
    EXPECT_TRUE(log.contains("(501/501) Personas not supported, using: " + def->shortDescription()))
        << log.all();
    EXPECT_EQ(cache.userIdentityForCurrentContext(), def);

    auto legacy = cache.userIdentityForLegacyMobileUser();
    EXPECT_EQ(legacy->posixUID(), 501u);
    EXPECT_EQ(legacy->kernelPersonaID(), 501u);
    EXPECT_EQ(cache.userIdentityForLegacyMobileUser(), legacy);

    int calls = 0;
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const QRNUserIdentityPtr& u) {
        ++calls;
        EXPECT_EQ(u, def);
    });
    EXPECT_EQ(calls, 1);
}

TEST_F(QRNUserIdentityCacheTest, RepopulationChoosesPersonalAndUnspecific) {
    QRNUserIdentityCache cache(root_.context(), true);
    auto list = personas();
    cache.flushAndRepopulateWithUserIdentities(list);
    EXPECT_EQ(cache.userIdentityForPersonalPersona(), list[0]);
    EXPECT_EQ(cache.unspecificUserIdentity(), list[3]);
    for (const auto& u : list) {
        EXPECT_EQ(cache.userIdentityWithPersonaID(u->kernelPersonaID()), u);
    }
    EXPECT_EQ(cache.userIdentityWithPersonaID(999), nullptr);

    // Without an unspecific persona one is made from the personal one; the
    // last personal persona of the list wins.
    auto second = make(501, kQRNPersonaTypePersonal, "personal-2", 2000, "/private/var/p2");
    cache.flushAndRepopulateWithUserIdentities({list[0], list[1], second});
    EXPECT_EQ(cache.userIdentityForPersonalPersona(), second);
    auto unspecific = cache.unspecificUserIdentity();
    ASSERT_NE(unspecific, nullptr);
    EXPECT_TRUE(unspecific->isNoSpecificPersona());
    EXPECT_EQ(unspecific->kernelPersonaID(), 2000u);
    EXPECT_EQ(unspecific->homeDirectoryURL(), second->homeDirectoryURL());
    EXPECT_EQ(unspecific->personaUniqueString(), second->personaUniqueString());
    EXPECT_EQ(cache.userIdentityWithPersonaID(1003), nullptr);
}

TEST_F(QRNUserIdentityCacheTest, PersonaLookupsWhenSupported) {
    LogCapture log;
    QRNUserIdentityCache cache(root_.context(), true);
    auto list = personas();
    cache.flushAndRepopulateWithUserIdentities(list);

    EXPECT_EQ(cache.userIdentityForPersonaUniqueString("ent-1", 501, 501), list[1]);
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString(std::nullopt, 0, 0), list[3]);
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString("nobody", 501, 501), nullptr);

    // Other ids: an updated copy; an enterprise persona keeps its own home,
    // the others move to the uid's home.
    auto moved = cache.userIdentityForPersonaUniqueString("ent-2", 650, 651);
    ASSERT_NE(moved, nullptr);
    EXPECT_EQ(moved->posixUID(), 650u);
    EXPECT_EQ(moved->posixGID(), 651u);
    EXPECT_EQ(moved->kernelPersonaID(), 1002u);
    EXPECT_EQ(moved->identifier(), "ent-2");
    EXPECT_EQ(moved->homeDirectoryURL(), root_ / "/private/var/ent2");
    auto personal = cache.userIdentityForPersonaUniqueString("personal", 650, 651);
    EXPECT_EQ(personal->homeDirectoryURL(), root_ / "/private/var/mobile");

    // An enterprise identity is found by its stored persona string.
    Value stored = list[2]->plist();
    stored.set("personaUniqueString", "ent-2");
    auto read = QRNUserIdentity::userIdentityWithPlist(stored, cache);
    ASSERT_TRUE(read);
    EXPECT_EQ(*read, list[2]);
    stored.set("personaUniqueString", "personal");
    read = QRNUserIdentity::userIdentityWithPlist(stored, cache);
    ASSERT_TRUE(read);
    EXPECT_EQ(*read, list[0]);
    EXPECT_TRUE(log.contains("to be enterprise, but it was not"));
    stored.set("personaUniqueString", "gone");
    read = QRNUserIdentity::userIdentityWithPlist(stored, cache);
    ASSERT_TRUE(read);
    EXPECT_EQ(*read, nullptr);

    std::vector<QRNUserIdentityPtr> visited;
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const QRNUserIdentityPtr& u) { visited.push_back(u); });
    EXPECT_EQ(visited.size(), list.size());
    cache.flush();
    visited.clear();
    cache.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const QRNUserIdentityPtr& u) { visited.push_back(u); });
    EXPECT_TRUE(visited.empty());
    EXPECT_TRUE(log.contains("Expected to find at least one persona"));
}

// A flush drops the personas; observers hear once of every enterprise
// identity dropped. Observers are held weakly.
TEST_F(QRNUserIdentityCacheTest, FlushNotifiesObserversOncePerDroppedIdentity) {
    QRNUserIdentityCache cache(root_.context(), true);
    auto first = std::make_shared<RecordingObserver>();
    auto second = std::make_shared<RecordingObserver>();
    auto gone = std::make_shared<RecordingObserver>();
    auto removed = std::make_shared<RecordingObserver>();
    for (const auto& o : {first, second, gone, removed}) {
        cache.addObserver(o);
    }
    cache.removeObserver(removed);
    std::weak_ptr<RecordingObserver> goneWeak = gone;
    gone.reset();
    EXPECT_TRUE(goneWeak.expired());

    cache.flushAndRepopulateWithUserIdentities(personas());
    EXPECT_TRUE(first->seen.empty()); // repopulating drops nothing by itself
    cache.flush();
    const std::map<std::string, int> expected{{"ent-1", 1}, {"ent-2", 1}};
    EXPECT_EQ(first->seen, expected);
    EXPECT_EQ(second->seen, expected);
    EXPECT_TRUE(removed->seen.empty());

    // After the flush the stored identities are the default and the maps
    // empty, until the next repopulation.
    auto def = cache.defaultUserIdentity();
    EXPECT_EQ(cache.userIdentityForPersonalPersona(), def);
    EXPECT_EQ(cache.unspecificUserIdentity(), def);
    EXPECT_EQ(cache.userIdentityWithPersonaID(1001), nullptr);
    EXPECT_EQ(cache.userIdentityForPersonaUniqueString("ent-1", 501, 501), nullptr);
    cache.flush();
    EXPECT_EQ(first->seen, expected);

    cache.flushAndRepopulateWithUserIdentities(personas());
    EXPECT_NE(cache.userIdentityWithPersonaID(1001), nullptr);
}

// A persona list update flushes in the background; observers hear of the
// dropped enterprise identities from the flush queue.
TEST_F(QRNUserIdentityCacheTest, PersonaListUpdateFlushesInTheBackground) {
    QRNUserIdentityCache cache(root_.context(), true);
    auto observer = std::make_shared<RecordingObserver>();
    cache.addObserver(observer);
    cache.flushAndRepopulateWithUserIdentities(personas());
    cache.personaListDidUpdate();
    ASSERT_TRUE(observer->waitFor(2));
    EXPECT_EQ(cache.userIdentityWithPersonaID(1001), nullptr);
    std::lock_guard guard(observer->mutex);
    EXPECT_EQ(observer->seen, (std::map<std::string, int>{{"ent-1", 1}, {"ent-2", 1}}));
}
