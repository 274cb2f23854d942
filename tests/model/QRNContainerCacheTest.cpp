#include "Daemon/model/QRNContainerCache.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentityCache.h"
#include "Daemon/platform/LinuxNotifications.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <future>
#include <latch>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

using namespace quarn;

namespace {

using Ids = std::vector<std::string>;
constexpr std::uint64_t kData = kQRNContainerClassAppData, kGroup = kQRNContainerClassAppGroup,
                        kSystem = kQRNContainerClassSystemData,
                        kBundle = kQRNContainerClassAppBundle,
                        kSysGroup = kQRNContainerClassSystemGroup;

class QRNContainerCacheTest : public quarn::test::TempRootTest {
protected:
    QRNContainerCache& cache() { return QRNContainerCache::sharedInstance(); }
    InMemorySandboxKernel& sandbox() {
        return dynamic_cast<InMemorySandboxKernel&>(root_.context().instance<SandboxKernel>());
    }
    QRNUserIdentityCache& identities() { return root_.context().instance<QRNUserIdentityCache>(); }
    QRNUserIdentityPtr mobile() { return identities().defaultUserIdentity(); }
    QRNUserIdentityPtr guest() {
        return identities().userIdentityForPersonalPersonaWithUID(502, 502);
    }

    std::filesystem::path classDirectory(std::uint64_t cls, bool transient = false) {
        return *QRNGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            mobile(), cls, transient);
    }

    // A directory (a fresh UUID unless named) with a metadata file written
    // the way the daemon writes it; `recordedClass` lets it lie about itself.
    QRNMetadataPtr makeContainer(std::uint64_t cls, const std::string& identifier,
                                 std::string name = {}, bool transient = false,
                                 std::uint64_t recordedClass = 0, QRNUserIdentityPtr owner = {}) {
        const UUID uuid = UUID::random();
        const auto url = classDirectory(cls, transient) / (name.empty() ? uuid.string() : name);
        std::filesystem::create_directories(url);
        auto concrete = QRNConcreteContainerIdentity::containerIdentityWithUUID(
            uuid, owner ? owner : mobile(), identifier, recordedClass ? recordedClass : cls);
        auto metadata = std::make_shared<const QRNMetadata>(*concrete, Value(), url, std::nullopt);
        EXPECT_TRUE(metadata->writeMetadataToFileURL(url / QRNMetadata::kFileName));
        return metadata;
    }

    QRNContainerIdentityPtr identity(std::uint64_t cls, const std::string& identifier) {
        return *QRNContainerIdentity::containerIdentityWithUserIdentity(mobile(), identifier, cls);
    }

    Ids identifiersOf(std::uint64_t cls) {
        auto all = cache().allContainersForUserIdentity(mobile(), cls, false);
        EXPECT_TRUE(all) << log_.all();
        Ids ids;
        for (const auto& metadata : all ? *all : std::vector<QRNMetadataPtr>{}) {
            ids.push_back(metadata->identifier());
        }
        std::sort(ids.begin(), ids.end());
        return ids;
    }

    std::vector<SandboxItem> mapped(std::uint32_t uid) {
        std::vector<SandboxItem> items;
        sandbox().forEachItem(uid, [&](const SandboxItem& item) {
            items.push_back(item);
            return true;
        });
        return items;
    }

    // Rebuilds of exactly this entry ("[501]-appData", "app(transient)").
    std::size_t rebuilds(std::string_view key) {
        const auto wanted = fmt::format("Rebuilding container class cache: {}", key);
        const auto lines = log_.messages();
        return static_cast<std::size_t>(std::count(lines.begin(), lines.end(), wanted));
    }

    // Until `n` requests have logged that they wait for a rebuild, or the
    // request has finished without waiting (the fault the caller looks for).
    template <typename T> void untilWaiting(std::size_t n, const std::future<T>& request) {
        while (log_.count("waiting for its rebuild") < n &&
               request.wait_for(std::chrono::seconds(0)) != std::future_status::ready) {
            std::this_thread::yield();
        }
    }

    std::size_t notificationsPosted() {
        std::ifstream in(LinuxNotifications(Paths(root_.path())).directory() /
                         Notifications::kUserInvalidated);
        return static_cast<std::size_t>(
            std::count(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>(), '\n'));
    }

    quarn::test::LogCapture log_;
};

// --- Building an entry from disk -------------------------------------------------------

// A listing keeps UUID-named directories whose metadata is valid for this
// user and class, and well-known system names; the rest is left out, and
// containers without valid metadata are reported. Files of one directory
// share the work of reading their stored user identity; one that stores
// another user's is still refused wherever it comes in the listing.
TEST_F(QRNContainerCacheTest, ListingKeepsValidContainersReportsTheRestAndFailsWhenUnlistable) {
    auto real = makeContainer(kData, "com.example.uuid");
    makeContainer(kData, "com.orvex.devicesettings", "com.orvex.devicesettings");
    // A link under a container's name is never taken for one.
    std::filesystem::create_directory_symlink(real->url(),
                                              classDirectory(kData) / UUID::random().string());
    const auto empty = classDirectory(kData) / UUID::random().string();
    std::filesystem::create_directories(empty);
    auto corrupt = makeContainer(kData, "com.example.corrupt");
    std::ofstream(corrupt->url() / QRNMetadata::kFileName, std::ios::trunc) << "garbage";
    makeContainer(kData, "com.example.group", {}, false, kGroup);
    Ids expected{"com.example.uuid"};
    for (int i = 0; i < 4; ++i) {
        expected.push_back(fmt::format("com.example.mine{}", i));
        makeContainer(kData, expected.back());
        makeContainer(kData, fmt::format("com.example.theirs{}", i), {}, false, 0, guest());
    }
    makeContainer(kSystem, "com.orvex.devicesettings", "com.orvex.devicesettings");
    makeContainer(kSystem, "systemgroup.com.orvex.pairing", "systemgroup.com.orvex.pairing");
    makeContainer(kSysGroup, "systemgroup.com.orvex.pairing", "systemgroup.com.orvex.pairing");
    makeContainer(kSysGroup, "systemgroup.com.orvex.uuid");

    std::sort(expected.begin(), expected.end());
    EXPECT_EQ(identifiersOf(kData), expected);
    EXPECT_EQ(identifiersOf(kSystem), Ids{"com.orvex.devicesettings"});
    EXPECT_EQ(identifiersOf(kSysGroup),
              (Ids{"systemgroup.com.orvex.pairing", "systemgroup.com.orvex.uuid"}));
    const auto reported = log_.count("Cache: [501]-appData: INCONSISTENT-No Metadata at: ");
    EXPECT_EQ(reported, 7u) << log_.all();
    EXPECT_EQ(log_.count("INCONSISTENT"), reported); // nothing in the system classes
    EXPECT_TRUE(log_.contains(fmt::format("INCONSISTENT-No Metadata at: {} for id: {}, class: 2",
                                          empty.string(), empty.filename().string())));

    // A class directory that cannot be listed fails the rebuild and keeps nothing.
    cache().invalidateUserIdentity(mobile());
    const auto dir = classDirectory(kData);
    std::filesystem::remove_all(dir);
    std::ofstream(dir) << "a file where the class directory belongs";
    auto all = cache().allContainersForUserIdentity(mobile(), kData, false);
    ASSERT_FALSE(all);
    EXPECT_TRUE(all.error().isQRN(kQRNErrorCacheRebuildFailed));
    EXPECT_EQ(all.error().message, "Cache: [501]-appData: Failed to rebuild");

    std::filesystem::remove(dir);
    makeContainer(kData, "com.example.back");
    EXPECT_EQ(identifiersOf(kData), Ids{"com.example.back"});
}

// --- Lookups --------------------------------------------------------------------------------

// A mapping the kernel kept while the daemon restarted answers without a
// scan when the metadata at its path validates; otherwise the scan decides.
// Then lookups answer from one build per entry; a concrete identity names
// one directory; of two containers with one identifier the later listed wins.
TEST_F(QRNContainerCacheTest, LookupsAnswerFromTheKernelOrOneBuildPerEntry) {
    auto made = makeContainer(kData, "com.example.app");
    auto impostor = makeContainer(kData, "com.example.impostor");
    const auto bare = classDirectory(kData) / "bare";
    std::filesystem::create_directories(bare);
    const auto id = identity(kData, "com.example.app");
    // The impostor's path and a directory without metadata fall back to the scan.
    for (const auto& path : {made->url(), impostor->url(), bare}) {
        SCOPED_TRACE(path);
        sandbox().setContainerMapping(501, {1, "com.example.app", kData, 501, path.string()});
        auto found = cache().containerForContainerIdentity(id, false, false, true);
        ASSERT_TRUE(found) << log_.all();
        EXPECT_EQ((*found)->uuid(), made->uuid());
        EXPECT_EQ(rebuilds("[501]-appData"), path == made->url() ? 0u : 1u);
        // Without the kernel's word the entry is built from disk.
        ASSERT_TRUE(cache().containerForContainerIdentity(id, false, false, false));
        EXPECT_EQ(rebuilds("[501]-appData"), 1u);
        cache().invalidateUserIdentity(mobile()); // back to an unbuilt entry
        log_.clear();
    }

    auto transient = makeContainer(kData, "com.example.app", {}, true);
    auto first = makeContainer(kData, "com.example.twice");
    auto second = makeContainer(kData, "com.example.twice");
    for (int i = 0; i < 2; ++i) {
        auto found = cache().containerForContainerIdentity(id);
        auto foundTransient = cache().containerForContainerIdentity(id, true);
        ASSERT_TRUE(found && foundTransient) << log_.all();
        EXPECT_EQ((*found)->uuid(), made->uuid());
        EXPECT_EQ((*foundTransient)->uuid(), transient->uuid());
    }
    EXPECT_EQ(rebuilds("[501]-appData"), 1u);
    EXPECT_EQ(rebuilds("[501]-appData(transient)"), 1u);
    // An unchanged directory lists in the same order every time.
    auto listed =
        *QRNFileManager::defaultManager().urlsForItemsInDirectoryAtURL(classDirectory(kData));
    auto later = std::find_if(listed.rbegin(), listed.rend(), [&](const auto& item) {
        return item.url == first->url() || item.url == second->url();
    });
    ASSERT_NE(later, listed.rend());
    auto twice = cache().containerForContainerIdentity(identity(kData, "com.example.twice"));
    ASSERT_TRUE(twice) << log_.all();
    EXPECT_EQ((*twice)->url(), later->url);

    auto missing = cache().containerForContainerIdentity(identity(kData, "com.example.none"), true);
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isQRN(kQRNErrorContainerNotFound));
    EXPECT_EQ(missing.error().message,
              "Cache: [501]-appData(transient): Container Not Found with ID: com.example.none");
    // A concrete identity names one directory, not any with its identifier.
    auto elsewhere = QRNConcreteContainerIdentity::containerIdentityWithUUID(
        UUID::random(), mobile(), "com.example.app", kData);
    EXPECT_FALSE(cache().containerForContainerIdentity(*elsewhere));
    EXPECT_TRUE(cache().containerForContainerIdentity(made->containerIdentity()));

    auto beyond = cache().allContainersForUserIdentity(mobile(), kQRNContainerClassMax, false);
    ASSERT_FALSE(beyond);
    EXPECT_TRUE(beyond.error().isQRN(kQRNErrorInvalidCacheInput));
}

// --- Builds running beside other requests -----------------------------------------------

// While one entry's scan is held, requests for other classes and users are
// answered; a lookup of the held entry and a removal from it wait, then the
// lookup gets the one build's record and the removal applies to the built
// entry (its container was still listed by the scan) and its mapping.
TEST_F(QRNContainerCacheTest, ARebuildStallsOnlyRequestsForItsOwnEntry) {
    auto held = makeContainer(kData, "com.example.held");
    makeContainer(kData, "com.example.gone");
    makeContainer(kGroup, "group.example");
    makeContainer(kSystem, "com.orvex.devicesettings", "com.orvex.devicesettings");
    std::promise<void> entered;
    std::latch release(1);
    std::atomic<int> dataScans = 0;
    cache().setRebuildGate([&](std::uint64_t cls) {
        if (cls == kData && dataScans++ == 0) {
            entered.set_value();
            release.wait();
        }
    });
    auto lookUp = [&](bool updateSandbox) {
        return std::async(std::launch::async, [this, updateSandbox] {
            return cache().containerForContainerIdentity(identity(kData, "com.example.held"), false,
                                                         updateSandbox);
        });
    };
    auto first = lookUp(false);
    entered.get_future().wait();
    EXPECT_EQ(identifiersOf(kGroup), Ids{"group.example"});
    EXPECT_EQ(identifiersOf(kSystem), Ids{"com.orvex.devicesettings"});
    EXPECT_TRUE(cache().allContainersForUserIdentity(guest(), kData, false));
    auto second = lookUp(true);
    untilWaiting(1, second);
    auto removal = std::async(std::launch::async, [this] {
        return cache().removeContainerForUserIdentity(mobile(), kData, "com.example.gone", false);
    });
    untilWaiting(2, removal);
    release.count_down();

    auto firstFound = first.get(), secondFound = second.get();
    ASSERT_TRUE(firstFound && secondFound) << log_.all();
    EXPECT_EQ((*firstFound)->uuid(), held->uuid());
    EXPECT_EQ(firstFound->get(), secondFound->get()); // the one record, not a second scan's
    EXPECT_TRUE(removal.get());
    cache().setRebuildGate({});
    EXPECT_EQ(rebuilds("[501]-appData"), 1u);
    EXPECT_EQ(identifiersOf(kData), Ids{"com.example.held"});
    auto items = mapped(501);
    ASSERT_EQ(items.size(), 1u) << log_.all();
    EXPECT_EQ(items[0].identifier, "com.example.held");
}

// An invalidation of the user while the entry is scanned makes the scan
// stale: it is redone, not published.
TEST_F(QRNContainerCacheTest, AnInvalidationDuringAScanHasItRedone) {
    makeContainer(kData, "com.example.app");
    int scans = 0;
    cache().setRebuildGate([&](std::uint64_t) {
        if (scans++ == 0) {
            cache().invalidateUserIdentity(mobile());
        }
    });
    EXPECT_EQ(identifiersOf(kData), Ids{"com.example.app"});
    cache().setRebuildGate({});
    EXPECT_EQ(scans, 2);
    EXPECT_EQ(rebuilds("[501]-appData"), 2u);
}

// Preparing builds an entry once, and not at all when the kernel's mapping
// would answer the lookup (never for a transient entry).
TEST_F(QRNContainerCacheTest, PreparingBuildsOnceUnlessTheKernelAnswers) {
    auto made = makeContainer(kData, "com.example.app");
    sandbox().setContainerMapping(501, {1, "com.example.app", kData, 501, made->url().string()});
    const auto id = identity(kData, "com.example.app");
    ASSERT_TRUE(cache().prepareEntryForContainerIdentity(id, false, true));
    EXPECT_EQ(rebuilds("[501]-appData"), 0u);
    for (int i = 0; i < 2; ++i) {
        ASSERT_TRUE(cache().prepareEntryForContainerIdentity(id, false, false));
        ASSERT_TRUE(cache().prepareEntryForContainerIdentity(id, true, true));
    }
    EXPECT_EQ(rebuilds("[501]-appData"), 1u);
    EXPECT_EQ(rebuilds("[501]-appData(transient)"), 1u);
}

// --- The kernel sandbox mapping -------------------------------------------------------------

// A replaced record takes its key with it: lookups and the removal of the
// mapping pushed for the old record still work once only the cache holds it.
TEST_F(QRNContainerCacheTest, AReplacedRecordKeepsItsSlotConsistent) {
    const std::string id = "com.example.replaced";
    auto first = makeContainer(kData, id);
    ASSERT_TRUE(cache().addContainerMetadata(first, first->url(), false, true));
    const auto firstURL = first->url();
    first.reset();
    auto second = makeContainer(kData, id);
    ASSERT_TRUE(cache().addContainerMetadata(second, second->url(), false, false));
    const auto secondURL = second->url();
    second.reset();

    auto found = cache().containerForContainerIdentity(identity(kData, id));
    ASSERT_TRUE(found);
    EXPECT_EQ((*found)->url(), secondURL);
    found = {};
    // The mapping is still the one pushed for the first record.
    auto items = mapped(501);
    ASSERT_EQ(items.size(), 1u);
    EXPECT_EQ(items[0].path, firstURL.native());

    ASSERT_TRUE(cache().removeContainerForUserIdentity(mobile(), kData, id, false));
    EXPECT_TRUE(mapped(501).empty());
    EXPECT_FALSE(log_.contains("Failed to remove container mapping")) << log_.all();
}

// Only permanent containers are mapped, an entry only once; invalidating a
// user removes its mappings and the global ones, not another user's; adding
// and removing a record pushes and removes its mapping.
TEST_F(QRNContainerCacheTest, TheSandboxMappingFollowsTheCache) {
    auto temp = makeContainer(kData, "com.example.t", {}, true);
    ASSERT_TRUE(cache().addContainerMetadata(temp, temp->url(), true, true));
    makeContainer(kGroup, "group.example");
    auto id = identity(kGroup, "group.example");
    ASSERT_TRUE(cache().containerForContainerIdentity(id));
    EXPECT_TRUE(mapped(501).empty());

    ASSERT_TRUE(cache().containerForContainerIdentity(id, false, true));
    ASSERT_TRUE(cache().containerForContainerIdentity(id, false, true));
    ASSERT_EQ(mapped(501).size(), 1u);
    EXPECT_EQ(log_.count("Pushed user: 501, itemType: 2, identifier group.example"), 1u);

    auto data = makeContainer(kData, "com.example.app");
    auto system = makeContainer(kSystem, "com.orvex.devicesettings", "com.orvex.devicesettings");
    for (const auto& made : {data, system}) {
        ASSERT_TRUE(cache().addContainerMetadata(made, made->url(), false, true));
    }
    const SandboxItem theirs{1, "com.example.theirs", kData, 502, "/x"};
    sandbox().setContainerMapping(502, theirs);

    cache().invalidateUserIdentity(mobile());
    EXPECT_TRUE(mapped(501).empty());
    EXPECT_TRUE(mapped(0).empty());
    EXPECT_EQ(mapped(502), std::vector<SandboxItem>{theirs});

    // Item type 0: never mapped.
    using Case = std::tuple<std::uint64_t, std::uint64_t, std::uint32_t>;
    for (const auto& [cls, itemType, uid] :
         {Case{1, 0, 0}, {2, 1, 501}, {7, 2, 501}, {12, 4, 0}, {13, 8, 0}}) {
        SCOPED_TRACE(cls);
        const std::string id = fmt::format("com.example.c{}", cls);
        auto made = makeContainer(cls, id);
        ASSERT_TRUE(cache().addContainerMetadata(made, made->url(), false, true)) << log_.all();
        const auto hasIt = [&](const SandboxItem& i) { return i.identifier == id; };
        auto items = mapped(uid);
        auto item = std::find_if(items.begin(), items.end(), hasIt);
        if (itemType == 0) {
            EXPECT_EQ(item, items.end());
            continue;
        }
        ASSERT_NE(item, items.end());
        EXPECT_EQ(*item, (SandboxItem{itemType, id, cls, 501, made->url().string()}));

        ASSERT_TRUE(cache().removeContainerForUserIdentity(mobile(), cls, id, false));
        items = mapped(uid);
        EXPECT_TRUE(std::none_of(items.begin(), items.end(), hasIt));
        EXPECT_FALSE(cache().containerForContainerIdentity(identity(cls, id)));
    }
    EXPECT_FALSE(log_.contains("Unsupported class")) << log_.all();
}

// --- Invalidation ----------------------------------------------------------------------------

TEST_F(QRNContainerCacheTest, InvalidatingOneUserRebuildsOnlyTheGlobalEntriesForAnother) {
    makeContainer(kGroup, "group.example");
    makeContainer(kBundle, "com.example.bundle");
    makeContainer(kSystem, "com.orvex.devicesettings", "com.orvex.devicesettings");
    auto lookUpAll = [&] {
        for (std::uint64_t cls : {kGroup, kBundle, kSystem}) {
            EXPECT_EQ(identifiersOf(cls).size(), 1u) << cls;
        }
    };
    lookUpAll();
    cache().invalidateUserIdentity(guest());
    lookUpAll();
    EXPECT_EQ(rebuilds("[501]-appGroup"), 1u);
    EXPECT_EQ(rebuilds("app"), 2u);
    EXPECT_EQ(rebuilds("systemData"), 2u);
    EXPECT_EQ(notificationsPosted(), 1u);

    cache().invalidateUserIdentity(mobile());
    lookUpAll();
    EXPECT_EQ(rebuilds("[501]-appGroup"), 2u);
    EXPECT_EQ(notificationsPosted(), 2u);
}

TEST_F(QRNContainerCacheTest, TheUserIdentityCacheTellsTheCacheWhomItDroppedWhileTheCacheLives) {
    auto enterprise = QRNUserIdentity::initWithUID(502, 502, root_ / "/private/var/mobile",
                                                   "persona-1", kQRNPersonaTypeEnterprise, 1000);
    auto dropEnterprise = [&] {
        identities().flushAndRepopulateWithUserIdentities({mobile(), enterprise});
        identities().flush();
    };
    {
        QRNContainerCache own(root_.context(),
                              root_.context().sharedInstance<QRNUserIdentityCache>());
        ASSERT_TRUE(own.allContainersForUserIdentity(enterprise, kData, false));
        dropEnterprise();
        EXPECT_EQ(notificationsPosted(), 1u);
        ASSERT_TRUE(own.allContainersForUserIdentity(enterprise, kData, false));
        EXPECT_EQ(rebuilds("[persona-1]-appData"), 2u);
    }
    dropEnterprise();
    EXPECT_EQ(notificationsPosted(), 1u);
}

} // namespace

namespace {

// A metadata file counts only as the daemon writes it; anything a user can
// plant in a directory of theirs is reported and stays out of the cache.
TEST_F(QRNContainerCacheTest, MetadataFilesUsersCouldPlantAreReportedAndNeverCached) {
    namespace fs = std::filesystem;
    struct Case {
        const char* name;
        std::function<void(const fs::path& dir, const fs::path& file)> plant;
        const char* reason; // in the report
    };
    const Case cases[] = {
        {"not root-owned", [](auto&, auto& file) { ASSERT_EQ(::chown(file.c_str(), 501, 501), 0); },
         "owned by uid 501"},
        {"two links",
         [](auto& dir, auto& file) { ASSERT_EQ(::link(file.c_str(), (dir / "x").c_str()), 0); },
         "2 links"},
        {"too big",
         [](auto&, auto& file) { std::ofstream(file, std::ios::app) << std::string(70000, ' '); },
         "bytes"},
        {"symlink",
         [](auto& dir, auto& file) {
             fs::rename(file, dir / "real");
             fs::create_symlink(dir / "real", file);
         },
         "not a regular file (mode 120000)"},
        {"not regular",
         [](auto&, auto& file) {
             fs::remove(file);
             ASSERT_EQ(::mkfifo(file.c_str(), 0600), 0);
         },
         "not a regular file (mode 10000)"},
        {"UUID mismatch",
         [](auto& dir, auto&) { fs::rename(dir, dir.parent_path() / UUID::random().string()); },
         "does not match its directory"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        auto made = makeContainer(kData, "com.example.planted");
        c.plant(made->url(), made->url() / QRNMetadata::kFileName);
        cache().invalidateUserIdentity(mobile());
        log_.clear();
        EXPECT_EQ(identifiersOf(kData), Ids{}) << log_.all();
        EXPECT_TRUE(log_.contains(c.reason)) << log_.all();
        EXPECT_TRUE(log_.contains("INCONSISTENT"));
        std::filesystem::remove_all(classDirectory(kData));
    }
}

} // namespace
