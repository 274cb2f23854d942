// Operations on existing containers: info values kept in the metadata file,
// the recorded protection class used when the default structure is made
// again, listing a class, and deletion staged on the command queue that runs
// when the request completes.

#include "CreateFixture.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/operations/QRNCommandStageForDelete.h"

#include <cerrno>
#include <functional>
#include <set>
#include <stdexcept>

using namespace quarn;
using namespace quarn::test;
namespace fs = std::filesystem;

namespace {

constexpr std::uint64_t kClass = kQRNContainerClassAppData;

// Records its name when run, then does what the test asks.
class ScriptedCommand final : public QRNCommand {
public:
    using Body = std::function<bool(const std::weak_ptr<QRNCommandQueue>&, std::uint64_t&)>;
    ScriptedCommand(std::string name, std::vector<std::string>& ran, Body body = {})
        : name_(std::move(name)), ran_(ran), body_(std::move(body)) {}
    std::uint64_t command() const override { return 900; }
    bool fromQueue(const std::weak_ptr<QRNCommandQueue>& queue, std::uint64_t& error) override {
        ran_.push_back(name_);
        return body_ ? body_(queue, error) : true;
    }

private:
    std::string name_;
    std::vector<std::string>& ran_;
    Body body_;
};

// Fails the cache removal of one identifier.
class FailingRemoval final : public QRNCommandStageForDelete {
public:
    FailingRemoval(std::vector<QRNContainerIdentityPtr> identities, ErrorBlock onError)
        : QRNCommandStageForDelete(std::move(identities), false, std::move(onError)) {}

protected:
    Status removeFromCache(const QRNContainerIdentity& identity, bool transient) override {
        if (identity.identifier() == "com.example.b") {
            return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidCacheInput, "refused"));
        }
        return QRNCommandStageForDelete::removeFromCache(identity, transient);
    }
};

class ContainerOperationsTest : public CreateFixture {
protected:
    std::shared_ptr<QRNClientConnection> withQueue(std::shared_ptr<QRNCommandQueue> queue) {
        auto client = QRNClientIdentity::privilegedClientIdentityWithUserIdentity(user(), false);
        return std::make_shared<QRNClientConnection>(client, true, true, true, std::nullopt,
                                                     std::nullopt, std::move(queue));
    }
    // The info value of `key` in the metadata file; none when missing.
    Value infoOnDisk(const QRNMetadataPtr& metadata, const char* key) {
        auto read = QRNMetadata::readAndValidateMetadataAtFileUrl(
            metadata->url() / QRNMetadata::kFileName, user(), true);
        EXPECT_TRUE(read.has_value());
        const Value* value = read ? (*read)->info().get(key) : nullptr;
        return value ? *value : Value();
    }
    // Runs one staged delete (with locking) on a fresh queue; answers its code.
    static std::uint64_t stage(std::vector<QRNContainerIdentityPtr> identities) {
        auto queue = std::make_shared<QRNCommandQueue>();
        queue->insertCommand(
            QRNCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                std::move(identities), true, nullptr));
        std::uint64_t error = kQRNErrorNone;
        queue->executeAllUntilExhaustedOrError(error);
        return error;
    }

    std::shared_ptr<QRNClientConnection> connection_ = privileged();
    std::shared_ptr<QRNCommandQueue> queue_ = std::make_shared<QRNCommandQueue>();
    std::vector<std::string> ran_;
};

TEST_F(ContainerOperationsTest, InfoValuesRecordedProtectionClassAndListing) {
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    const auto id = made->containerIdentity();
    const Value key("color");
    // A failed write leaves file and cache as they were.
    env_->failCall(EnvCall::Rename, 1, EIO);
    EXPECT_EQ(connection_->setInfoValue(Value("blue"), &key, id, true).error(),
              kQRNErrorWriteStateFileFailed);
    EXPECT_EQ(infoOnDisk(made, "color"), Value());
    EXPECT_EQ(connection_->infoValueForKey(&key, id, true).error(), kQRNErrorInfoValueNotFound);
    // An exception becomes code 40 and gives the identifier lock back.
    env_->setHook([](EnvCall call, std::uint64_t) {
        if (call == EnvCall::Rename) {
            throw std::runtime_error("injected");
        }
    });
    EXPECT_EQ(connection_->setInfoValue(Value("blue"), &key, id, true).error(), kQRNErrorException);
    env_->setHook(nullptr);

    ASSERT_TRUE(connection_->setInfoValue(Value("blue"), &key, id, true));
    auto read = connection_->infoValueForKey(&key, identity(kClientBundle, kClass), true);
    ASSERT_TRUE(read.has_value());
    EXPECT_EQ(*read, Value("blue"));
    EXPECT_EQ(infoOnDisk(made, "color"), Value("blue"));

    // A none value removes the key, from the cache and from the file.
    ASSERT_TRUE(connection_->setInfoValue(Value(), &key, id, true));
    EXPECT_EQ(connection_->infoValueForKey(&key, id, true).error(), kQRNErrorInfoValueNotFound);
    EXPECT_EQ(infoOnDisk(made, "color"), Value());

    const Value numberKey(7);
    for (const Value* bad : {static_cast<const Value*>(nullptr), &numberKey}) {
        EXPECT_EQ(connection_->setInfoValue(Value("x"), bad, id, true).error(),
                  kQRNErrorBadRequestArgument);
        EXPECT_EQ(connection_->infoValueForKey(bad, id, true).error(), kQRNErrorBadRequestArgument);
    }
    const auto absent = identity("com.absent", kClass);
    EXPECT_EQ(connection_->setInfoValue(Value("x"), &key, absent, true).error(),
              kQRNErrorContainerNotFound);

    // The default structure made again uses the recorded protection class.
    const Value classKey("com.orvex.Brevon.ContentProtectionClass");
    ASSERT_TRUE(connection_->setInfoValue(Value(3), &classKey, id, true));
    fs::remove_all(made->url() / "Library");
    fs::remove_all(made->url() / "SystemData");

    ASSERT_TRUE(connection_->recreateDefaultStructureWithContainerIdentity(
        identity(kClientBundle, kClass)));
    for (const char* name : {"Library", "Library/Caches", "Library/Preferences", "SystemData"}) {
        auto cls =
            QRNFileManager::defaultManager().dataProtectionClassOfItemAtURL(made->url() / name);
        ASSERT_TRUE(cls.has_value()) << name;
        EXPECT_EQ(*cls, std::string_view(name) == "SystemData" ? 0 : 3) << name;
    }

    // Listing a class: the client's user's permanent containers of that class.
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
    EXPECT_EQ(identifiers,
              (std::set<std::string>{kClientBundle, "com.example.one", "com.example.two"}));

    for (std::uint64_t invalid : {0ull, 14ull}) {
        EXPECT_EQ(connection_->containersWithClass(invalid, false).error(),
                  kQRNErrorInvalidArgument);
    }
}

TEST_F(ContainerOperationsTest, QueuedCommandsRunInOrderWhenTheRequestCompletes) {
    std::uint64_t error = kQRNErrorNone;
    EXPECT_FALSE(queue_->executeNextCommandWithError(error));
    EXPECT_EQ(error, kQRNErrorCommandQueueExhausted);
    std::uint64_t handlerError = kQRNErrorContainerNotFound;
    EXPECT_TRUE(withQueue(queue_)->completeWithError(handlerError));
    EXPECT_EQ(handlerError, kQRNErrorContainerNotFound) << "a failed request stays failed";

    queue_->insertCommand(std::make_shared<ScriptedCommand>(
        "a", ran_, [this](const std::weak_ptr<QRNCommandQueue>& queue, std::uint64_t&) {
            auto self = queue.lock();
            EXPECT_EQ(self, queue_);
            self->insertCommand(std::make_shared<ScriptedCommand>(
                "b", ran_, [this](const std::weak_ptr<QRNCommandQueue>& inner, std::uint64_t&) {
                    inner.lock()->insertCommand(std::make_shared<ScriptedCommand>("e", ran_));
                    return true;
                }));
            self->insertCommand(std::make_shared<ScriptedCommand>("c", ran_));
            // Another thread inserting while this command runs must not
            // wait for it to finish.
            std::thread([&] {
                self->insertCommand(std::make_shared<ScriptedCommand>("d", ran_));
            }).join();
            return true;
        }));
    error = kQRNErrorNone;
    EXPECT_TRUE(queue_->executeAllUntilExhaustedOrError(error));
    EXPECT_EQ(error, kQRNErrorNone);
    EXPECT_EQ(ran_, (std::vector<std::string>{"a", "b", "c", "d", "e"}));

    // Deletion is queued and happens when the request completes.
    auto made = create(kClientBundle, kClass);
    ASSERT_TRUE(made);
    auto request = withQueue(queue_);
    ASSERT_TRUE(
        request->deleteContainerWithContainerIdentity(identity(kClientBundle, kClass), false));
    EXPECT_TRUE(fs::exists(made->url())) << "still there until the queued commands run";
    EXPECT_TRUE(request->completeWithError(error));
    EXPECT_EQ(error, kQRNErrorNone);
    EXPECT_FALSE(fs::exists(made->url()));
    EXPECT_EQ(request->deleteContainerWithContainerIdentity(identity(kClientBundle, kClass), false)
                  .error(),
              kQRNErrorContainerNotFound);
}

TEST_F(ContainerOperationsTest, StagedContainersGoToDeathRowAndLeaveTheCacheVanishedAreSkipped) {
    QRNMetadataPtr a = create("com.example.a", kClass);
    QRNMetadataPtr b = create("com.example.b", kClass);
    ASSERT_TRUE(a && b);
    auto vanished = *QRNConcreteContainerIdentity::containerIdentityWithUUID(
        UUID::random(), a->userIdentity(), "com.example.a", kClass);
    EXPECT_EQ(stage({vanished, identity("com.example.a", kClass), b->containerIdentity()}),
              kQRNErrorNone);
    for (const QRNMetadataPtr& gone : {a, b}) {
        EXPECT_FALSE(fs::exists(gone->url())) << gone->identifier();
        EXPECT_TRUE(fs::exists(deathRow() / gone->url().filename() / QRNMetadata::kFileName));
        EXPECT_FALSE(cached(identity(gone->identifier(), kClass)));
    }

    // A failed move to death row removes in place; a failed removal is
    // logged, not reported, and the container is forgotten all the same.
    QRNMetadataPtr c = create("com.example.c", kClass);
    QRNMetadataPtr d = create("com.example.d", kClass);
    ASSERT_TRUE(c && d);
    env_->failCall(EnvCall::Rename, 1, EACCES);
    EXPECT_EQ(stage({identity("com.example.c", kClass)}), kQRNErrorNone);
    EXPECT_FALSE(fs::exists(c->url()));
    EXPECT_FALSE(fs::exists(deathRow() / c->url().filename()));
    LogCapture log;
    env_->failCall(EnvCall::Rename, 1, EIO);
    env_->failCallsFrom(EnvCall::Unlink, 1, EBUSY);
    EXPECT_EQ(stage({identity("com.example.d", kClass)}), kQRNErrorNone);
    env_->clearFailures();
    EXPECT_TRUE(log.contains("Failed to delete container at")) << log.all();
    EXPECT_TRUE(fs::exists(d->url())) << "nothing could be removed";
    EXPECT_FALSE(cached(identity("com.example.d", kClass)));

    // A transient bundle keeps the code-signing records while a permanent one exists.
    QRNMetadataPtr permanent = create("com.example.app", kQRNContainerClassAppBundle);
    QRNMetadataPtr transient = create("com.example.app", kQRNContainerClassAppBundle, true);
    ASSERT_TRUE(permanent && transient);
    log.clear();
    EXPECT_EQ(stage({transient->containerIdentity()}), kQRNErrorNone);
    EXPECT_TRUE(log.contains("Skipping removal of code sign mapping")) << log.all();
    EXPECT_FALSE(fs::exists(transient->url()));
    EXPECT_FALSE(cached(transient->containerIdentity(), true));
    EXPECT_TRUE(cached(permanent->containerIdentity())) << "the permanent container stays";
    log.clear();
    EXPECT_EQ(stage({permanent->containerIdentity()}), kQRNErrorNone);
    EXPECT_FALSE(log.contains("Skipping removal of code sign mapping"));
    EXPECT_FALSE(fs::exists(permanent->url()));

    // A failing cache removal stops the command before later identities,
    // and the commands behind it stay queued.
    QRNMetadataPtr later = create("com.example.c", kClass);
    ASSERT_TRUE(create("com.example.a", kClass) && create("com.example.b", kClass) && later);
    std::vector<std::uint64_t> reported;
    queue_->insertCommand(std::make_shared<FailingRemoval>(
        std::vector{identity("com.example.a", kClass), identity("com.example.b", kClass),
                    identity("com.example.c", kClass)},
        [&](std::uint64_t code) { reported.push_back(code); }));
    queue_->insertCommand(std::make_shared<ScriptedCommand>("after", ran_));
    std::uint64_t error = kQRNErrorNone;
    EXPECT_FALSE(withQueue(queue_)->completeWithError(error));
    EXPECT_EQ(error, kQRNErrorCacheRemoveFailed);
    EXPECT_EQ(reported, std::vector<std::uint64_t>{kQRNErrorCacheRemoveFailed});
    EXPECT_TRUE(ran_.empty());
    EXPECT_EQ(queue_->count(), 1u);
    EXPECT_FALSE(cached(identity("com.example.a", kClass)));
    EXPECT_TRUE(cached(identity("com.example.c", kClass)));
    EXPECT_TRUE(fs::exists(later->url() / QRNMetadata::kFileName)) << "later identities untouched";
}

} // namespace
