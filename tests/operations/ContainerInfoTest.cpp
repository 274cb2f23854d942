// The smaller operations on existing containers: info values kept in the
// metadata file, the recorded protection class used when the default
// structure is made again, listing a class, and deletion at request end.

#include "CreateFixture.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/operations/QRNCommandQueue.h"

#include "common/LogCapture.h"

#include <cerrno>
#include <set>
#include <stdexcept>

using namespace quarn;
using namespace quarn::test;

namespace {

constexpr std::uint64_t kClass = kQRNContainerClassAppData;

class ContainerInfoTest : public CreateFixture {
protected:
    ContainerInfoTest() : connection_(privileged()) {}

    Value infoOnDisk(const QRNMetadataPtr& metadata) {
        auto read = QRNMetadata::readAndValidateMetadataAtFileUrl(
            metadata->url() / QRNMetadata::kFileName, user(), true);
        EXPECT_TRUE(read.has_value());
        return read ? (*read)->info() : Value();
    }
    std::shared_ptr<QRNClientConnection> withQueue() {
        auto client = QRNClientIdentity::privilegedClientIdentityWithUserIdentity(user(), false);
        return std::make_shared<QRNClientConnection>(client, true, true, true, std::nullopt,
                                                     std::nullopt,
                                                     std::make_shared<QRNCommandQueue>());
    }

    std::shared_ptr<QRNClientConnection> connection_;
};

TEST_F(ContainerInfoTest, InfoValuesAreWrittenReadAndRemoved) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    const Value key("color");
    ASSERT_TRUE(connection_->setInfoValue(Value("blue"), &key, made->containerIdentity(), true));
    auto read = connection_->infoValueForKey(&key, identity(kClientBundle, kClass), true);
    ASSERT_TRUE(read.has_value());
    EXPECT_EQ(*read, Value("blue"));
    ASSERT_NE(infoOnDisk(made).get("color"), nullptr);
    EXPECT_EQ(*infoOnDisk(made).get("color"), Value("blue"));

    // A none value removes the key, from the cache and from the file.
    ASSERT_TRUE(connection_->setInfoValue(Value(), &key, made->containerIdentity(), true));
    LogCapture log;
    auto gone = connection_->infoValueForKey(&key, made->containerIdentity(), true);
    ASSERT_FALSE(gone.has_value());
    EXPECT_EQ(gone.error(), kQRNErrorInfoValueNotFound);
    EXPECT_TRUE(log.contains("Didn't find info value for key: color")) << log.all();
    EXPECT_EQ(infoOnDisk(made).get("color"), nullptr);
}

TEST_F(ContainerInfoTest, InfoOperationsRefuseBadKeysAndMissingContainers) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    const Value numberKey(7);
    for (const Value* key : {static_cast<const Value*>(nullptr), &numberKey}) {
        EXPECT_EQ(
            connection_->setInfoValue(Value("x"), key, made->containerIdentity(), true).error(),
            kQRNErrorBadRequestArgument);
        EXPECT_EQ(connection_->infoValueForKey(key, made->containerIdentity(), true).error(),
                  kQRNErrorBadRequestArgument);
    }
    const Value key("color");
    LogCapture log;
    EXPECT_EQ(
        connection_->setInfoValue(Value("x"), &key, identity("com.absent", kClass), true).error(),
        kQRNErrorContainerNotFound);
    EXPECT_TRUE(log.contains("No Container with identity: ")) << log.all();
    EXPECT_EQ(connection_->metadataWithContainerIdentity(identity("com.absent", kClass)).error(),
              kQRNErrorContainerNotFound);
    EXPECT_TRUE(log.contains("No Container with user identity: ")) << log.all();
}

TEST_F(ContainerInfoTest, FailedInfoWriteLeavesFileAndCacheAsTheyWere) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    const Value key("color");
    env_->failCall(EnvCall::Rename, 1, EIO);
    EXPECT_EQ(
        connection_->setInfoValue(Value("blue"), &key, made->containerIdentity(), true).error(),
        kQRNErrorWriteStateFileFailed);
    EXPECT_EQ(infoOnDisk(made).get("color"), nullptr);
    EXPECT_EQ(connection_->infoValueForKey(&key, made->containerIdentity(), true).error(),
              kQRNErrorInfoValueNotFound);
}

TEST_F(ContainerInfoTest, RecreatedStructureUsesTheRecordedProtectionClass) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    const Value key("com.orvex.Brevon.ContentProtectionClass");
    ASSERT_TRUE(connection_->setInfoValue(Value(3), &key, made->containerIdentity(), true));
    std::filesystem::remove_all(made->url() / "Library");
    std::filesystem::remove_all(made->url() / "SystemData");

    ASSERT_TRUE(connection_->recreateDefaultStructureWithContainerIdentity(
        identity(kClientBundle, kClass)));
    auto& fileManager = QRNFileManager::defaultManager();
    for (const char* name : {"Library", "Library/Caches", "Library/Preferences"}) {
        auto cls = fileManager.dataProtectionClassOfItemAtURL(made->url() / name);
        ASSERT_TRUE(cls.has_value()) << name;
        EXPECT_EQ(*cls, 3) << name;
    }
    auto systemData = fileManager.dataProtectionClassOfItemAtURL(made->url() / "SystemData");
    ASSERT_TRUE(systemData.has_value());
    EXPECT_EQ(*systemData, 0);
}

TEST_F(ContainerInfoTest, ContainersOfAClassAreListedForTheClientsUser) {
    create("com.example.one", kClass);
    create("com.example.two", kClass);
    create("com.example.three", kClass, true);
    create("com.example.four", kQRNContainerClassPluginData);
    auto listed = connection_->containersWithClass(kClass, false);
    ASSERT_TRUE(listed.has_value());
    std::set<std::string> identifiers;
    for (const auto& metadata : *listed) {
        identifiers.insert(metadata->identifier());
    }
    EXPECT_EQ(identifiers, (std::set<std::string>{"com.example.one", "com.example.two"}));

    LogCapture log;
    for (std::uint64_t invalid : {0ull, 14ull}) {
        auto refused = connection_->containersWithClass(invalid, false);
        ASSERT_FALSE(refused.has_value());
        EXPECT_EQ(refused.error(), kQRNErrorInvalidArgument);
    }
    EXPECT_TRUE(log.contains("Can't act on an invalid container class: 14")) << log.all();
}

TEST_F(ContainerInfoTest, DeletionHappensWhenTheRequestCompletes) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    auto request = withQueue();
    ASSERT_TRUE(
        request->deleteContainerWithContainerIdentity(identity(kClientBundle, kClass), false));
    // Still there until the queued commands run.
    EXPECT_TRUE(std::filesystem::exists(made->url()));
    std::uint64_t error = kQRNErrorNone;
    EXPECT_TRUE(request->completeWithError(error));
    EXPECT_EQ(error, kQRNErrorNone);
    EXPECT_FALSE(std::filesystem::exists(made->url()));
    EXPECT_EQ(connection_->metadataWithContainerIdentity(identity(kClientBundle, kClass)).error(),
              kQRNErrorContainerNotFound);

    LogCapture log;
    EXPECT_EQ(request->deleteContainerWithContainerIdentity(identity(kClientBundle, kClass), false)
                  .error(),
              kQRNErrorContainerNotFound);
    EXPECT_TRUE(log.contains("Failed to lookup existing container to delete-identity: "))
        << log.all();
}

TEST_F(ContainerInfoTest, ExceptionInsideAnOperationBecomesCodeForty) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    env_->setHook([](EnvCall call, std::uint64_t) {
        if (call == EnvCall::Rename) {
            throw std::runtime_error("injected");
        }
    });
    const Value key("color");
    EXPECT_EQ(
        connection_->setInfoValue(Value("blue"), &key, made->containerIdentity(), true).error(),
        kQRNErrorException);
    env_->setHook(nullptr);
    // The identifier lock was given back.
    EXPECT_TRUE(connection_->setInfoValue(Value("blue"), &key, made->containerIdentity(), true));
}

} // namespace
