// A creation that fails at any step reports that step's code, leaves nothing
// at the live path, sends its staging directory to death row and gives the
// global lock back.

#include "CreateFixture.h"

#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNLocks.h"

#include "common/LogCapture.h"

#include <cerrno>
#include <stdexcept>

using namespace quarn;
using namespace quarn::test;

namespace {

constexpr std::uint64_t kClass = kQRNContainerClassAppData;

class CreateOrLookupFailureTest : public CreateFixture {
protected:
    void SetUp() override { primeDirectories(kClass); }

    std::uint64_t createCode(bool transient = false) {
        auto made = privileged()->createOrLookupContainerWithContainerIdentity(
            identity(kClientBundle, kClass), true, transient, true);
        return made ? kQRNErrorNone : made.error();
    }
    void expectGlobalLockFree() {
        EXPECT_EQ(QRNLocks::shared().snapshot().allReaderWriterState, 0);
    }
    // Nothing live, nothing left in staging, the staging directory parked on death row.
    void expectStagingOnDeathRow() {
        EXPECT_TRUE(namesIn(classDirectory(kClass)).empty());
        EXPECT_TRUE(namesIn(stagingDirectory(kClass)).empty());
        const auto parked = namesOnDeathRow();
        ASSERT_EQ(parked.size(), 1u);
        EXPECT_TRUE(UUID::parse(parked[0]).has_value()) << parked[0];
    }
};

TEST_F(CreateOrLookupFailureTest, MissingIdentityIsABadRequest) {
    LogCapture log;
    auto made =
        privileged()->createOrLookupContainerWithContainerIdentity(nullptr, true, false, true);
    ASSERT_FALSE(made.has_value());
    EXPECT_EQ(made.error(), kQRNErrorBadRequestArgument);
    EXPECT_TRUE(log.contains("Cannot lookup a nil container identity.")) << log.all();
}

TEST_F(CreateOrLookupFailureTest, StagingDirectoryThatCannotBeMadeLeavesNothing) {
    env_->failCall(EnvCall::Mkdir, 1, EIO);
    LogCapture log;
    EXPECT_EQ(createCode(), kQRNErrorCreateStagingFailed);
    EXPECT_TRUE(log.contains("Failed to create staging dir at")) << log.all();
    EXPECT_TRUE(namesIn(classDirectory(kClass)).empty());
    EXPECT_TRUE(namesIn(stagingDirectory(kClass)).empty());
    EXPECT_TRUE(namesOnDeathRow().empty());
    expectGlobalLockFree();
}

TEST_F(CreateOrLookupFailureTest, EachLaterStepFailsWithItsCodeAndParksTheStagingDirectory) {
    struct Case {
        const char* what;
        EnvCall call;
        std::uint64_t nth;
        std::uint64_t code;
        const char* message;
    };
    // Renames: the metadata file into the container, then the container into place.
    const Case cases[] = {
        {"metadata", EnvCall::Rename, 1, kQRNErrorWriteStateFileFailed,
         "Failed to move metadata from staging"},
        {"subdirectory", EnvCall::Mkdir, 2, kQRNErrorCreateDirFailed,
         "Failed to create sub-dir for"},
        {"move into place", EnvCall::Rename, 2, kQRNErrorMoveStagingToLiveFailed,
         "Failed to move staging dir:"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        env_->failCall(c.call, c.nth, EIO);
        LogCapture log;
        EXPECT_EQ(createCode(), c.code);
        EXPECT_TRUE(log.contains(c.message)) << log.all();
        expectStagingOnDeathRow();
        expectGlobalLockFree();
        env_->clearFailures();
        for (const std::string& unique : namesIn(deathRow())) {
            std::filesystem::remove_all(deathRow() / unique);
        }
    }
    // Nothing of the failures stands in the way of the next creation.
    EXPECT_EQ(createCode(), kQRNErrorNone);
}

TEST_F(CreateOrLookupFailureTest, StagingThatCannotBeParkedIsReported) {
    // The move into place and the move to death row both fail.
    env_->failCallsFrom(EnvCall::Rename, 2, EIO);
    LogCapture log;
    EXPECT_EQ(createCode(), kQRNErrorRemoveStagingFailed);
    EXPECT_TRUE(log.contains("Failed to remove staging dir:")) << log.all();
    EXPECT_TRUE(namesIn(classDirectory(kClass)).empty());
    EXPECT_EQ(namesIn(stagingDirectory(kClass)).size(), 1u);
    expectGlobalLockFree();
}

TEST_F(CreateOrLookupFailureTest, OldTransientContainerThatCannotBeRemovedStopsTheCreation) {
    ASSERT_EQ(createCode(true), kQRNErrorNone);
    const auto before = namesIn(classDirectory(kClass, true));
    ASSERT_EQ(before.size(), 1u);
    env_->failCallsFrom(EnvCall::Rename, 1, EIO);
    LogCapture log;
    EXPECT_EQ(createCode(true), kQRNErrorRemoveTransientFailed);
    EXPECT_TRUE(log.contains("Failed to remove transient container at")) << log.all();
    EXPECT_EQ(namesIn(classDirectory(kClass, true)), before);
    EXPECT_TRUE(namesIn(stagingDirectory(kClass)).empty());
    expectGlobalLockFree();
}

TEST_F(CreateOrLookupFailureTest, CacheThatRefusesTheNewContainerLeavesItInPlace) {
    // Just before the container moves into place its cache entry is dropped
    // and the class directory can no longer be listed, so inserting fails.
    const std::uint64_t moveIntoPlace = env_->count(EnvCall::Rename) + 2;
    env_->setHook([this, moveIntoPlace](EnvCall call, std::uint64_t number) {
        if (call == EnvCall::Rename && number == moveIntoPlace) {
            QRNContainerCache::sharedInstance().invalidateUserIdentity(user());
            env_->failCallsFrom(EnvCall::OpenDir, 1, EIO);
        }
    });
    LogCapture log;
    EXPECT_EQ(createCode(), kQRNErrorCacheAddFailed);
    EXPECT_TRUE(log.contains("Failed to add to cache : ")) << log.all();
    EXPECT_EQ(namesIn(classDirectory(kClass)).size(), 1u);
    EXPECT_TRUE(namesOnDeathRow().empty());
    expectGlobalLockFree();

    // Once the directory can be read again the container is found there.
    env_->setHook(nullptr);
    env_->clearFailures();
    bool existed = false;
    auto found = privileged()->createOrLookupContainerWithContainerIdentity(
        identity(kClientBundle, kClass), true, false, true, &existed);
    ASSERT_TRUE(found.has_value());
    EXPECT_TRUE(existed);
}

TEST_F(CreateOrLookupFailureTest, ExceptionBecomesCodeFortyAndCleansUp) {
    const std::uint64_t firstSubdirectory = env_->count(EnvCall::Mkdir) + 2;
    env_->setHook([firstSubdirectory](EnvCall call, std::uint64_t number) {
        if (call == EnvCall::Mkdir && number == firstSubdirectory) {
            throw std::runtime_error("injected");
        }
    });
    LogCapture log;
    EXPECT_EQ(createCode(), kQRNErrorException);
    EXPECT_TRUE(log.contains("Got exception: ")) << log.all();
    EXPECT_TRUE(log.contains("injected")) << log.all();
    env_->setHook(nullptr);
    expectStagingOnDeathRow();
    expectGlobalLockFree();
    EXPECT_EQ(createCode(), kQRNErrorNone);
}

} // namespace
