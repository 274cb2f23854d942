// Create or look up: what a creation leaves on disk, finding instead of
// creating, transient containers and concurrent creations.

#include "CreateFixture.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/protection/QRNDataProtectionManager.h"

#include "common/LogCapture.h"

#include <sys/xattr.h>

#include <latch>
#include <thread>

using namespace quarn;
using namespace quarn::test;

namespace {

constexpr std::uint32_t kNobody32 = 4294967294u;

class CreateOrLookupTest : public CreateFixture {
protected:
    mode_t modeOf(const std::filesystem::path& path) { return lstatOf(path).st_mode & 07777; }
    int protectionClassOf(const std::filesystem::path& path) {
        auto cls = QRNFileManager::defaultManager().dataProtectionClassOfItemAtURL(path);
        EXPECT_TRUE(cls.has_value()) << path;
        return cls ? *cls : -1;
    }
    // Entitlements of every identifier ask for the given protection level.
    void entitlementsAskFor(std::string_view level) {
        Value entitlements = Value::dictionary();
        entitlements.set("com.orvex.developer.default-data-protection", Value(level));
        QRNDataProtectionManager::defaultManager().setEntitlementsSource(
            [entitlements](std::string_view) { return std::optional<Value>(entitlements); });
    }
};

TEST_F(CreateOrLookupTest, CreatesOnceAndThenFindsWithoutTouchingTheDisk) {
    auto connection = connectionFor(kClientBundle);
    bool existed = true;
    auto made = connection->createOrLookupContainerWithContainerIdentity(
        identity(kClientBundle, kQRNContainerClassAppData), true, false, true, &existed);
    ASSERT_TRUE(made.has_value()) << made.error();
    EXPECT_FALSE(existed);
    const std::filesystem::path url = (*made)->url();
    EXPECT_EQ(url.parent_path(), classDirectory(kQRNContainerClassAppData));
    EXPECT_EQ(url.filename().string(), (*made)->uuid().string());
    EXPECT_TRUE(namesIn(stagingDirectory(kQRNContainerClassAppData)).empty());

    // The file on disk describes the container that was handed out.
    auto read =
        QRNMetadata::readAndValidateMetadataAtFileUrl(url / QRNMetadata::kFileName, user(), true);
    ASSERT_TRUE(read.has_value());
    EXPECT_EQ((*read)->identifier(), kClientBundle);
    EXPECT_EQ((*read)->uuid(), (*made)->uuid());

    const std::uint64_t callsBefore = env_->count(EnvCall::Mkdir) + env_->count(EnvCall::Rename);
    for (bool createIfNecessary : {false, true}) {
        existed = false;
        auto found = connection->createOrLookupContainerWithContainerIdentity(
            identity(kClientBundle, kQRNContainerClassAppData), createIfNecessary, false, true,
            &existed);
        ASSERT_TRUE(found.has_value());
        EXPECT_TRUE(existed);
        EXPECT_EQ((*found)->uuid(), (*made)->uuid());
        EXPECT_EQ((*found)->url(), url);
    }
    EXPECT_EQ(env_->count(EnvCall::Mkdir) + env_->count(EnvCall::Rename), callsBefore);
    EXPECT_EQ(namesIn(classDirectory(kQRNContainerClassAppData)).size(), 1u);
}

TEST_F(CreateOrLookupTest, LookupOfAnAbsentContainerFailsWithNotFoundAndMakesNothing) {
    LogCapture log;
    auto found = connectionFor(kClientBundle)
                     ->createOrLookupContainerWithContainerIdentity(
                         identity(kClientBundle, kQRNContainerClassAppData), false, false, true);
    ASSERT_FALSE(found.has_value());
    EXPECT_EQ(found.error(), kQRNErrorContainerNotFound);
    EXPECT_TRUE(log.contains("Container with identifier: \"com.example.client\" Not Found"))
        << log.all();
    EXPECT_TRUE(namesIn(classDirectory(kQRNContainerClassAppData)).empty());
}

TEST_F(CreateOrLookupTest, DataContainerSubdirectoriesHaveOwnerModeAndProtectionClass) {
    entitlementsAskFor(QRNDataProtectionManager::kProtectionComplete);
    auto made = create(kClientBundle, kQRNContainerClassAppData);
    ASSERT_TRUE(made);
    const std::filesystem::path url = made->url();
    EXPECT_EQ(lstatOf(url).st_uid, kMobileUID);
    EXPECT_EQ(modeOf(url), 0755u);
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
}

TEST_F(CreateOrLookupTest, RecreatedStructureIsNeverMadeThroughALinkInTheContainer) {
    auto made = create(kClientBundle, kQRNContainerClassAppData);
    ASSERT_TRUE(made);
    const std::filesystem::path url = made->url();
    const std::filesystem::path outside = root_.path() / "outside";
    std::filesystem::create_directories(outside);
    std::filesystem::remove_all(url / "Library");
    std::filesystem::create_directory_symlink(outside, url / "Library");

    auto recreated = privileged()->recreateDefaultStructureWithContainerIdentity(
        identity(kClientBundle, kQRNContainerClassAppData));
    ASSERT_FALSE(recreated);
    EXPECT_EQ(recreated.error(), kQRNErrorCreateDirFailed);
    EXPECT_TRUE(namesIn(outside).empty());
    EXPECT_EQ(lstatOf(outside).st_uid, 0u);
}

TEST_F(CreateOrLookupTest, SystemContainersAreClosedAndOwnedByNobody) {
    // Entitlements choose protection classes for data containers only.
    entitlementsAskFor(QRNDataProtectionManager::kProtectionComplete);
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
}

TEST_F(CreateOrLookupTest, WellKnownSystemContainersLiveUnderTheirNames) {
    auto settings = create("com.orvex.devicesettings", kQRNContainerClassSystemData);
    ASSERT_TRUE(settings);
    EXPECT_EQ(settings->url(),
              classDirectory(kQRNContainerClassSystemData) / "com.orvex.devicesettings");
    auto group = create("systemgroup.com.orvex.pairing", kQRNContainerClassSystemGroup);
    ASSERT_TRUE(group);
    EXPECT_EQ(group->url().filename(), "systemgroup.com.orvex.pairing");

    // Found again under the name (the cache accepts well-known names).
    bool existed = false;
    auto found = privileged()->createOrLookupContainerWithContainerIdentity(
        identity("com.orvex.devicesettings", kQRNContainerClassSystemData), false, false, true,
        &existed);
    ASSERT_TRUE(found.has_value());
    EXPECT_TRUE(existed);
    EXPECT_EQ((*found)->uuid(), settings->uuid());
}

TEST_F(CreateOrLookupTest, BundleContainersBelongToTheInstaller) {
    auto made = create("com.example.app", kQRNContainerClassAppBundle);
    ASSERT_TRUE(made);
    EXPECT_EQ(lstatOf(made->url()).st_uid, 33u);
    // No subdirectories: only the metadata file.
    EXPECT_EQ(namesIn(made->url()), std::vector<std::string>{std::string(QRNMetadata::kFileName)});
}

TEST_F(CreateOrLookupTest, TransientContainersAreNeverReused) {
    auto first = create(kClientBundle, kQRNContainerClassAppData, true);
    ASSERT_TRUE(first);
    EXPECT_EQ(first->url().parent_path(), classDirectory(kQRNContainerClassAppData, true));
    auto second = create(kClientBundle, kQRNContainerClassAppData, true);
    ASSERT_TRUE(second);
    EXPECT_NE(first->uuid(), second->uuid());
    EXPECT_FALSE(std::filesystem::exists(first->url()));
    EXPECT_TRUE(std::filesystem::exists(second->url()));
    EXPECT_EQ(namesOnDeathRow(), std::vector<std::string>{first->uuid().string()});

    // A transient request never looks without creating, even though one exists.
    auto lookup = privileged()->createOrLookupContainerWithContainerIdentity(
        identity(kClientBundle, kQRNContainerClassAppData), false, true, true);
    ASSERT_FALSE(lookup.has_value());
    EXPECT_EQ(lookup.error(), kQRNErrorContainerNotFound);
    EXPECT_TRUE(std::filesystem::exists(second->url()));
    // A permanent container of the identifier is another container.
    auto permanent = create(kClientBundle, kQRNContainerClassAppData);
    ASSERT_TRUE(permanent);
    EXPECT_NE(permanent->uuid(), second->uuid());
}

TEST_F(CreateOrLookupTest, ConcurrentCreationsOfOneIdentityMakeOneContainer) {
    constexpr int kThreads = 4;
    std::latch start(kThreads);
    std::vector<std::thread> threads;
    std::vector<CodeResult<QRNMetadataPtr>> results(kThreads, QRN_CODE(kQRNErrorNone));
    std::vector<int> existed(kThreads, -1);
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&, i] {
            auto connection = connectionFor(kClientBundle);
            auto id = identity(kClientBundle, kQRNContainerClassAppData);
            bool flag = false;
            start.arrive_and_wait();
            results[i] = connection->createOrLookupContainerWithContainerIdentity(id, true, false,
                                                                                  true, &flag);
            existed[i] = flag ? 1 : 0;
        });
    }
    for (auto& thread : threads) {
        thread.join();
    }
    int created = 0;
    for (int i = 0; i < kThreads; ++i) {
        ASSERT_TRUE(results[i].has_value()) << results[i].error();
        EXPECT_EQ((*results[i])->uuid(), (*results[0])->uuid());
        created += existed[i] == 0 ? 1 : 0;
    }
    EXPECT_EQ(created, 1);
    EXPECT_EQ(namesIn(classDirectory(kQRNContainerClassAppData)).size(), 1u);
}

TEST_F(CreateOrLookupTest, FastSizingSwitchSizesTheNewContainer) {
    LogCapture log;
    create("com.example.unsized", kQRNContainerClassAppData);
    EXPECT_FALSE(log.contains("CalculatingDiskUsage")) << log.all();

    root_.writeFile("/etc/quarnd/features/quarnd.plist",
                    R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
<key>fast_container_sizing</key><dict><key>Enabled</key><true/></dict>
</dict></plist>)");
    log.clear();
    auto sized = create("com.example.sized", kQRNContainerClassAppData);
    ASSERT_TRUE(sized);
    EXPECT_TRUE(log.contains("CalculatingDiskUsage")) << log.all();
    EXPECT_TRUE(log.contains(sized->url().string())) << log.all();
}

} // namespace
