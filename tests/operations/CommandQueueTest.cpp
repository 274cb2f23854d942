#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/operations/QRNCommandStageForDelete.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <functional>
#include <future>
#include <thread>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

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

std::shared_ptr<QRNClientConnection> connectionWith(std::shared_ptr<QRNCommandQueue> queue) {
    return std::make_shared<QRNClientConnection>(
        QRNClientIdentity::anonymousPrivilegedClientIdentity(), true, true, true, std::nullopt,
        std::nullopt, std::move(queue));
}

class CommandQueueTest : public test::TempRootTest {
protected:
    std::shared_ptr<QRNCommandQueue> queue_ = std::make_shared<QRNCommandQueue>();
    std::vector<std::string> ran_;
};

TEST_F(CommandQueueTest, EmptyQueueIsExhaustedAndCompletionKeepsTheHandlersCode) {
    std::uint64_t error = kQRNErrorNone;
    EXPECT_TRUE(queue_->executeAllUntilExhaustedOrError(error));
    EXPECT_EQ(error, kQRNErrorNone);
    EXPECT_FALSE(queue_->executeNextCommandWithError(error));
    EXPECT_EQ(error, kQRNErrorCommandQueueExhausted);

    auto connection = connectionWith(queue_);
    std::uint64_t handlerError = kQRNErrorContainerNotFound;
    EXPECT_TRUE(connection->completeWithError(handlerError));
    EXPECT_EQ(handlerError, kQRNErrorContainerNotFound) << "a failed request stays failed";
}

TEST_F(CommandQueueTest, CommandsInsertedWhileRunningAreAllRunInOrder) {
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
    std::uint64_t error = kQRNErrorNone;
    EXPECT_TRUE(queue_->executeAllUntilExhaustedOrError(error));
    EXPECT_EQ(error, kQRNErrorNone);
    EXPECT_EQ(ran_, (std::vector<std::string>{"a", "b", "c", "d", "e"}));
    EXPECT_EQ(queue_->count(), 0u);
}

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

class StageForDeleteTest : public ::testing::Test {
protected:
    StageForDeleteTest() : env_(std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>())) {
        root_.context().install<Env>(env_);
    }

    static QRNContainerIdentityPtr identity(const std::string& identifier,
                                            std::uint64_t cls = kQRNContainerClassAppData) {
        auto user = QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity();
        return *QRNContainerIdentity::containerIdentityWithUserIdentity(user, identifier, cls);
    }
    static QRNMetadataPtr create(const std::string& identifier,
                                 std::uint64_t cls = kQRNContainerClassAppData,
                                 bool transient = false) {
        auto made = QRNClientConnection::sharedClientConnection()
                        .createOrLookupContainerWithContainerIdentity(identity(identifier, cls),
                                                                      true, transient, true);
        EXPECT_TRUE(made.has_value()) << identifier << ": code " << (made ? 1 : made.error());
        return made ? *made : nullptr;
    }
    static bool cached(const QRNContainerIdentityPtr& identity, bool transient = false) {
        return QRNContainerCache::sharedInstance()
            .containerForContainerIdentity(identity, transient)
            .has_value();
    }
    static fs::path deathRow() {
        return QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
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

    test::TempRoot root_;
    std::shared_ptr<FaultInjectingEnv> env_;
};

TEST_F(StageForDeleteTest, ContainersGoToDeathRowAndLeaveTheCacheVanishedOnesAreSkipped) {
    QRNMetadataPtr a = create("com.example.a");
    QRNMetadataPtr b = create("com.example.b");
    ASSERT_TRUE(a && b);
    auto vanished = *QRNConcreteContainerIdentity::containerIdentityWithUUID(
        UUID::random(), a->userIdentity(), "com.example.a", kQRNContainerClassAppData);
    EXPECT_EQ(stage({vanished, identity("com.example.a"), b->containerIdentity()}), kQRNErrorNone);
    for (const QRNMetadataPtr& gone : {a, b}) {
        EXPECT_FALSE(fs::exists(gone->url())) << gone->identifier();
        EXPECT_TRUE(fs::exists(deathRow() / gone->url().filename() / QRNMetadata::kFileName));
        EXPECT_FALSE(cached(identity(gone->identifier())));
    }
}

TEST_F(StageForDeleteTest, FailingCacheRemovalStopsTheCommandBeforeLaterIdentities) {
    QRNMetadataPtr c = create("com.example.c");
    ASSERT_TRUE(create("com.example.a") && create("com.example.b") && c);
    std::vector<std::uint64_t> reported;
    auto queue = std::make_shared<QRNCommandQueue>();
    queue->insertCommand(std::make_shared<FailingRemoval>(
        std::vector{identity("com.example.a"), identity("com.example.b"),
                    identity("com.example.c")},
        [&](std::uint64_t code) { reported.push_back(code); }));
    std::vector<std::string> ran;
    queue->insertCommand(std::make_shared<ScriptedCommand>("after", ran));
    std::uint64_t error = kQRNErrorNone;
    EXPECT_FALSE(connectionWith(queue)->completeWithError(error));
    EXPECT_EQ(error, kQRNErrorCacheRemoveFailed);
    EXPECT_EQ(reported, std::vector<std::uint64_t>{kQRNErrorCacheRemoveFailed});
    EXPECT_TRUE(ran.empty());
    EXPECT_EQ(queue->count(), 1u) << "the commands behind the failed one stay queued";
    EXPECT_FALSE(cached(identity("com.example.a")));
    EXPECT_TRUE(cached(identity("com.example.c")));
    EXPECT_TRUE(fs::exists(c->url() / QRNMetadata::kFileName)) << "later identities untouched";
}

TEST_F(StageForDeleteTest, FailedMoveRemovesInPlaceAndAFailedRemovalIsNotReported) {
    QRNMetadataPtr a = create("com.example.a");
    QRNMetadataPtr b = create("com.example.b");
    ASSERT_TRUE(a && b);
    env_->failCall(EnvCall::Rename, 1, EACCES);
    EXPECT_EQ(stage({identity("com.example.a")}), kQRNErrorNone);
    EXPECT_FALSE(fs::exists(a->url()));
    EXPECT_FALSE(fs::exists(deathRow() / a->url().filename()));

    test::LogCapture log;
    env_->failCall(EnvCall::Rename, 1, EIO);
    env_->failCallsFrom(EnvCall::Unlink, 1, EBUSY);
    EXPECT_EQ(stage({identity("com.example.b")}), kQRNErrorNone);
    env_->clearFailures();
    EXPECT_TRUE(log.contains("Failed to delete container at")) << log.all();
    EXPECT_TRUE(fs::exists(b->url())) << "nothing could be removed";
    EXPECT_FALSE(cached(identity("com.example.b"))) << "but the container is forgotten";
}

TEST_F(StageForDeleteTest, TransientBundleKeepsCodeSigningRecordsWhileAPermanentOneExists) {
    QRNMetadataPtr permanent = create("com.example.app", kQRNContainerClassAppBundle);
    QRNMetadataPtr transient = create("com.example.app", kQRNContainerClassAppBundle, true);
    ASSERT_TRUE(permanent && transient);
    test::LogCapture log;
    EXPECT_EQ(stage({transient->containerIdentity()}), kQRNErrorNone);
    EXPECT_TRUE(log.contains("Skipping removal of code sign mapping")) << log.all();
    EXPECT_FALSE(fs::exists(transient->url()));
    EXPECT_FALSE(cached(transient->containerIdentity(), true));
    EXPECT_TRUE(cached(permanent->containerIdentity())) << "the permanent container stays";

    log.clear();
    EXPECT_EQ(stage({permanent->containerIdentity()}), kQRNErrorNone);
    EXPECT_FALSE(log.contains("Skipping removal of code sign mapping"));
    EXPECT_FALSE(fs::exists(permanent->url()));
}

} // namespace
