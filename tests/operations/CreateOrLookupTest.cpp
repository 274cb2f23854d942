// Create or look up: what a creation leaves on disk, finding instead of
// creating, transient containers, concurrent creations, who may ask for
// which container, and how a creation that fails cleans up.

#include "CreateFixture.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNLocks.h"
#include "Daemon/protection/QRNDataProtectionManager.h"

#include <sys/xattr.h>

#include <cerrno>
#include <future>
#include <latch>
#include <set>
#include <stdexcept>

using namespace quarn;
using namespace quarn::test;

namespace {

constexpr std::uint64_t kClass = kQRNContainerClassAppData;
constexpr std::uint32_t kNobody32 = 4294967294u;

class CreateOrLookupTest : public CreateFixture {
protected:
    int protectionClassOf(const std::filesystem::path& path) {
        auto cls = QRNFileManager::defaultManager().dataProtectionClassOfItemAtURL(path);
        EXPECT_TRUE(cls.has_value()) << path;
        return cls ? *cls : -1;
    }
    // Entitlements of every identifier ask for complete protection.
    void entitlementsAskForComplete() {
        Value entitlements = dictionaryOf({{"com.orvex.developer.default-data-protection",
                                            Value(QRNDataProtectionManager::kProtectionComplete)}});
        QRNDataProtectionManager::defaultManager().setEntitlementsSource(
            [entitlements](std::string_view) { return std::optional<Value>(entitlements); });
    }
    // The code of a lookup (create = false) or creation; 1 when it succeeds.
    std::uint64_t codeOf(QRNClientConnection& connection, const std::string& identifier,
                         std::uint64_t cls, bool create = false, bool transient = false) {
        auto found = connection.createOrLookupContainerWithContainerIdentity(
            identity(identifier, cls), create, transient, true);
        return found ? kQRNErrorNone : found.error();
    }
};

TEST_F(CreateOrLookupTest, LooksUpNothingThenCreatesOnceAndThenFindsWithoutTouchingTheDisk) {
    entitlementsAskForComplete();
    auto connection = connectionFor(kClientBundle);
    EXPECT_EQ(codeOf(*connection, kClientBundle, kClass), kQRNErrorContainerNotFound);

    bool existed = true;
    auto made = connection->createOrLookupContainerWithContainerIdentity(
        identity(kClientBundle, kClass), true, false, true, &existed);
    ASSERT_TRUE(made.has_value()) << made.error();
    EXPECT_FALSE(existed);
    const std::filesystem::path url = (*made)->url();
    EXPECT_EQ(url, classDirectory(kClass) / (*made)->uuid().string());
    EXPECT_TRUE(namesIn(stagingDirectory(kClass)).empty());

    const std::uint64_t callsBefore = env_->count(EnvCall::Mkdir) + env_->count(EnvCall::Rename);
    for (bool createIfNecessary : {false, true}) {
        existed = false;
        auto found = connection->createOrLookupContainerWithContainerIdentity(
            identity(kClientBundle, kClass), createIfNecessary, false, true, &existed);
        ASSERT_TRUE(found.has_value());
        EXPECT_TRUE(existed);
        EXPECT_EQ((*found)->uuid(), (*made)->uuid());
    }
    EXPECT_EQ(env_->count(EnvCall::Mkdir) + env_->count(EnvCall::Rename), callsBefore);

    EXPECT_EQ(lstatOf(url).st_uid, kMobileUID);
    EXPECT_EQ(lstatOf(url).st_mode & 07777, 0755u);
    EXPECT_EQ(protectionClassOf(url), 0);
    for (const char* name :
         {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}) {
        SCOPED_TRACE(name);
        const struct stat st = lstatOf(url / name);
        EXPECT_TRUE(S_ISDIR(st.st_mode));
        EXPECT_EQ(st.st_mode & 07777, 0755u);
        EXPECT_EQ(st.st_uid, kMobileUID);
        EXPECT_EQ(st.st_gid, kMobileUID);
        // The daemon's own item stays readable whatever the lock state.
        EXPECT_EQ(protectionClassOf(url / name), std::string_view(name) == "SystemData" ? 0 : 1);
    }

    // The default structure is never made again through a link in the container.
    const std::filesystem::path outside = root_.path() / "outside";
    std::filesystem::create_directories(outside);
    std::filesystem::remove_all(url / "Library");
    std::filesystem::create_directory_symlink(outside, url / "Library");

    auto recreated = privileged()->recreateDefaultStructureWithContainerIdentity(
        identity(kClientBundle, kClass));
    ASSERT_FALSE(recreated);
    EXPECT_EQ(recreated.error(), kQRNErrorCreateDirFailed);
    EXPECT_TRUE(namesIn(outside).empty());
    EXPECT_EQ(lstatOf(outside).st_uid, 0u);
}

TEST_F(CreateOrLookupTest, SystemContainersAreClosedAndOwnedByNobodyTransientOnesNeverReused) {
    // Entitlements choose protection classes for data containers only.
    entitlementsAskForComplete();
    auto made = create("com.example.system", kQRNContainerClassSystemData);
    ASSERT_TRUE(made);
    // Not well known: named by its UUID.
    EXPECT_EQ(made->url().filename().string(), made->uuid().string());
    EXPECT_EQ(lstatOf(made->url()).st_uid, 0u);
    // The system users' group gets in through the top level's ACL.
    EXPECT_GT(::getxattr(made->url().c_str(), "system.posix_acl_default", nullptr, 0), 0);
    for (const char* name : {"Library", "Library/Caches", "Library/Preferences"}) {
        SCOPED_TRACE(name);
        const struct stat st = lstatOf(made->url() / name);
        EXPECT_EQ(st.st_mode & 07777, 0u);
        EXPECT_EQ(st.st_uid, kNobody32);
        EXPECT_EQ(protectionClassOf(made->url() / name), 0);
    }
    EXPECT_EQ(namesIn(made->url()).size(), 2u); // metadata and Library

    // Bundle containers belong to the installer and hold only the metadata file.
    auto bundle = create("com.example.app", kQRNContainerClassAppBundle);
    ASSERT_TRUE(bundle);
    EXPECT_EQ(lstatOf(bundle->url()).st_uid, 33u);
    EXPECT_EQ(namesIn(bundle->url()),
              std::vector<std::string>{std::string(QRNMetadata::kFileName)});

    auto first = create(kClientBundle, kClass, true);
    ASSERT_TRUE(first);
    EXPECT_EQ(first->url().parent_path(), classDirectory(kClass, true));
    auto second = create(kClientBundle, kClass, true);
    ASSERT_TRUE(second);
    EXPECT_NE(first->uuid(), second->uuid());
    EXPECT_FALSE(std::filesystem::exists(first->url()));
    EXPECT_EQ(namesOnDeathRow(), std::vector<std::string>{first->uuid().string()});

    // A transient request never looks without creating, even though one exists.
    EXPECT_EQ(codeOf(*privileged(), kClientBundle, kClass, false, true),
              kQRNErrorContainerNotFound);
    EXPECT_TRUE(std::filesystem::exists(second->url()));
    // A permanent container of the identifier is another container.
    auto permanent = create(kClientBundle, kClass);
    ASSERT_TRUE(permanent);
    EXPECT_NE(permanent->uuid(), second->uuid());
}

TEST_F(CreateOrLookupTest, ConcurrentCreationsOfOneIdentityMakeOneContainer) {
    constexpr int kThreads = 4;
    std::latch start(kThreads);
    std::vector<std::future<std::pair<std::string, bool>>> results;
    for (int i = 0; i < kThreads; ++i) {
        results.push_back(std::async(std::launch::async, [&] {
            auto connection = connectionFor(kClientBundle);
            auto id = identity(kClientBundle, kClass);
            bool existed = false;
            start.arrive_and_wait();
            auto made = connection->createOrLookupContainerWithContainerIdentity(id, true, false,
                                                                                 true, &existed);
            return std::pair{made ? (*made)->uuid().string() : "failed", existed};
        }));
    }
    std::set<std::string> uuids;
    int created = 0;
    for (auto& result : results) {
        auto [uuid, existed] = result.get();
        uuids.insert(uuid);
        created += existed ? 0 : 1;
    }
    EXPECT_EQ(uuids.size(), 1u);
    EXPECT_EQ(created, 1);
    EXPECT_EQ(namesIn(classDirectory(kClass)),
              std::vector<std::string>(uuids.begin(), uuids.end()));
}

TEST_F(CreateOrLookupTest, FastSizingSwitchSizesTheNewContainer) {
    LogCapture log;
    create("com.example.unsized", kClass);
    EXPECT_FALSE(log.contains("CalculatingDiskUsage")) << log.all();
    root_.writeFile("/etc/quarnd/features/quarnd.plist",
                    R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
<key>fast_container_sizing</key><dict><key>Enabled</key><true/></dict>
</dict></plist>)");
    log.clear();
    auto sized = create("com.example.sized", kClass);
    ASSERT_TRUE(sized);
    EXPECT_TRUE(log.contains("CalculatingDiskUsage")) << log.all();
    EXPECT_TRUE(log.contains(sized->url().string())) << log.all();
}

// Access: who may look up which container. A lookup that passes the checks
// answers "not found" (21); a refused one "not entitled" (55).

TEST_F(CreateOrLookupTest, EachRightAndLookupGrantAdmitsOnItsOwn) {
    const std::uint64_t app = kClass, group = kQRNContainerClassAppGroup,
                        sysGroup = kQRNContainerClassSystemGroup,
                        sysData = kQRNContainerClassSystemData,
                        plugin = kQRNContainerClassPluginData;
    const std::uint64_t found = kQRNErrorContainerNotFound, refused = kQRNErrorNotEntitled;
    auto lookingUp = [&](const char* client, const char* shortName, Value granted) {
        return connectionFor(client, false, dictionaryOf({{shortName, std::move(granted)}}));
    };
    auto none = connectionFor(kClientBundle);
    // A refusal comes before any disk access.
    std::uint64_t calls = 0;
    env_->setHook([&calls](EnvCall, std::uint64_t) { ++calls; });
    EXPECT_EQ(codeOf(*none, "com.other.app", app, true), refused);
    EXPECT_EQ(calls, 0u);
    env_->setHook(nullptr);

    auto groups = connectionFor(kClientBundle);
    groups->setAllowGroupIdLookup(true);
    // Elements that are not strings are skipped, not the whole list.
    auto listed = lookingUp(kClientBundle, "appData",
                            arrayOf({Value(7), Value("com.other.app"), dictionaryOf({})}));
    auto misTyped = lookingUp(kClientBundle, "appData", Value("com.other.app"));
    auto search = connectionFor("com.orvex.searchd");
    auto daemon = connectionFor("com.example.daemon");
    auto declared =
        lookingUp("com.example.daemon", "systemData", arrayOf({Value("com.example.daemon")}));
    auto accounts = connectionFor("com.orvex.accountsd");
    const struct {
        const char* what;
        std::shared_ptr<QRNClientConnection> connection;
        const char* identifier;
        std::uint64_t cls;
        std::uint64_t code;
    } cases[] = {
        {"no right", none, "com.other.app", app, refused},
        {"other ids", connectionFor(kClientBundle, true), "com.other.app", app, found},
        {"unrestricted", privileged(), "com.other.app", app, found},
        {"group right, app group", groups, "group.other", group, found},
        {"group right, system group", groups, "systemgroup.other", sysGroup, found},
        {"group right is for groups only", groups, "com.other.app", app, refused},
        {"listed identifier", listed, "com.other.app", app, found},
        {"unlisted identifier", listed, "com.third.app", app, refused},
        {"listed under another class", listed, "com.other.app", plugin, refused},
        {"a string where an array belongs", misTyped, "com.other.app", app, refused},
        {"well-known exception", search, "com.orvex.notes", app, found},
        {"exception of another class", search, "com.orvex.notes", plugin, refused},
        {"exception of another identifier", search, "com.orvex.photos", app, refused},
        {"open to everyone", none, "systemgroup.com.orvex.diagnostics", sysGroup, found},
        {"own identifier, other class", daemon, "com.example.daemon", app, found},
        {"own system container, undeclared", daemon, "com.example.daemon", sysData, refused},
        {"own system container, declared", declared, "com.example.daemon", sysData, found},
        {"well-known system client, its own", accounts, "com.orvex.accountsd", sysData, found},
        {"well-known system client, another's", accounts, "com.orvex.devicesettings", sysData,
         refused},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(codeOf(*c.connection, c.identifier, c.cls), c.code) << c.what;
    }
}

// Failures: a creation that fails at any step reports that step's code,
// leaves nothing at the live path, sends its staging directory to death row
// and gives the global lock back.
class CreateFailureTest : public CreateOrLookupTest {
protected:
    // Makes the directories a creation needs first, so that fault counts
    // start at the container itself, and the cache entry of the class, so no
    // listing happens later.
    void SetUp() override {
        classDirectory(kClass);
        stagingDirectory(kClass);
        deathRow();
        ASSERT_EQ(codeOf(*privileged(), "com.example.absent", kClass), kQRNErrorContainerNotFound);
    }
    std::uint64_t createCode(bool transient = false) {
        return codeOf(*privileged(), kClientBundle, kClass, true, transient);
    }
};

TEST_F(CreateFailureTest, EachStepFailsWithItsCodeAndParksTheStagingDirectory) {
    EXPECT_EQ(privileged()
                  ->createOrLookupContainerWithContainerIdentity(nullptr, true, false, true)
                  .error(),
              kQRNErrorBadRequestArgument);
    const struct {
        const char* what;
        EnvCall call;
        std::uint64_t nth; // renames: the metadata file, then the container into place
        bool throws;
        bool onwards; // every later call fails too
        std::uint64_t code;
    } cases[] = {
        {"staging", EnvCall::Mkdir, 1, false, false, kQRNErrorCreateStagingFailed},
        {"metadata", EnvCall::Rename, 1, false, false, kQRNErrorWriteStateFileFailed},
        {"subdirectory", EnvCall::Mkdir, 2, false, false, kQRNErrorCreateDirFailed},
        {"move into place", EnvCall::Rename, 2, false, false, kQRNErrorMoveStagingToLiveFailed},
        {"exception", EnvCall::Mkdir, 2, true, false, kQRNErrorException},
        // The move into place and the move to death row both fail.
        {"staging cannot be parked", EnvCall::Rename, 2, false, true, kQRNErrorRemoveStagingFailed},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        if (c.throws) {
            env_->setHook([call = c.call, n = env_->count(c.call) + c.nth](EnvCall made,
                                                                           std::uint64_t number) {
                if (made == call && number == n) {
                    throw std::runtime_error("injected");
                }
            });
        } else if (c.onwards) {
            env_->failCallsFrom(c.call, c.nth, EIO);
        } else {
            env_->failCall(c.call, c.nth, EIO);
        }
        const bool unparked = c.code == kQRNErrorRemoveStagingFailed;
        EXPECT_EQ(createCode(), c.code);
        EXPECT_TRUE(namesIn(classDirectory(kClass)).empty());
        EXPECT_EQ(namesIn(stagingDirectory(kClass)).size(), unparked ? 1u : 0u);
        // The staging directory is parked on death row once it was made.
        const auto parked = namesOnDeathRow();
        ASSERT_EQ(parked.size(), c.code == kQRNErrorCreateStagingFailed || unparked ? 0u : 1u);
        EXPECT_TRUE(parked.empty() || UUID::parse(parked[0]).has_value()) << parked[0];
        EXPECT_EQ(QRNLocks::shared().snapshot().allReaderWriterState, 0);
        env_->setHook(nullptr);
        env_->clearFailures();
        for (const Path& directory : {deathRow(), stagingDirectory(kClass)}) {
            for (const std::string& name : namesIn(directory)) {
                std::filesystem::remove_all(directory / name);
            }
        }
    }
    // A cache that refuses the new container leaves it in place: just before
    // it moves into place its cache entry is dropped and the class directory
    // can no longer be listed, so inserting fails.
    const std::uint64_t moveIntoPlace = env_->count(EnvCall::Rename) + 2;
    env_->setHook([this, moveIntoPlace](EnvCall call, std::uint64_t number) {
        if (call == EnvCall::Rename && number == moveIntoPlace) {
            QRNContainerCache::sharedInstance().invalidateUserIdentity(user());
            env_->failCallsFrom(EnvCall::OpenDir, 1, EIO);
        }
    });
    EXPECT_EQ(createCode(), kQRNErrorCacheAddFailed);
    EXPECT_EQ(namesIn(classDirectory(kClass)).size(), 1u);
    EXPECT_TRUE(namesOnDeathRow().empty());
    EXPECT_EQ(QRNLocks::shared().snapshot().allReaderWriterState, 0);
    env_->setHook(nullptr);
    env_->clearFailures();
    EXPECT_EQ(codeOf(*privileged(), kClientBundle, kClass), kQRNErrorNone) << "found once readable";

    // An old transient container that cannot be removed stops the creation.
    ASSERT_EQ(createCode(true), kQRNErrorNone);
    const auto before = namesIn(classDirectory(kClass, true));
    ASSERT_EQ(before.size(), 1u);
    env_->failCallsFrom(EnvCall::Rename, 1, EIO);
    EXPECT_EQ(createCode(true), kQRNErrorRemoveTransientFailed);
    EXPECT_EQ(namesIn(classDirectory(kClass, true)), before);
    EXPECT_TRUE(namesIn(stagingDirectory(kClass)).empty());
    EXPECT_EQ(QRNLocks::shared().snapshot().allReaderWriterState, 0);
}

} // namespace
