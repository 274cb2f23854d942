#include "CreateFixture.h"

#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/support/Queue.h"

#include <algorithm>
#include <fstream>

namespace quarn::test {

CreateFixture::CreateFixture(bool holdDeathRow)
    : holdDeathRow_(holdDeathRow),
      env_(std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>())) {
    // Before anything makes the file manager, which takes the Env once.
    root_.context().install<Env>(env_);
    if (holdDeathRow_) {
        QRNClientConnection::_sharedDeathrowBackgroundQueue()->suspend();
    }
}

CreateFixture::~CreateFixture() {
    env_->clearFailures();
    env_->setHook(nullptr);
    // Let the deletion passes run to their end while the root still exists.
    if (holdDeathRow_) {
        QRNClientConnection::_sharedDeathrowBackgroundQueue()->resume();
    }
    drainBackground();
}

std::shared_ptr<QRNClientConnection> CreateFixture::connectionFor(const std::string& bundle,
                                                                  Rights rights) {
    auto client = QRNClientIdentity::initWithBundleIdentifier(
        bundle, kMobileUID, kMobileUID, 4242, user(), Value::dictionary(), false,
        QRNClientIdentity::AuditToken{}, false);
    return std::make_shared<QRNClientConnection>(client, rights.unrestricted, rights.otherIds,
                                                 rights.unrestricted, rights.lookup, std::nullopt,
                                                 nullptr);
}

QRNUserIdentityPtr CreateFixture::user() {
    return QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity();
}

QRNContainerIdentityPtr CreateFixture::identity(const std::string& identifier, std::uint64_t cls) {
    auto made = QRNContainerIdentity::containerIdentityWithUserIdentity(user(), identifier, cls);
    EXPECT_TRUE(made.has_value());
    return made ? *made : nullptr;
}

QRNMetadataPtr CreateFixture::create(const std::string& identifier, std::uint64_t cls,
                                     bool transient) {
    auto made = privileged()->createOrLookupContainerWithContainerIdentity(
        identity(identifier, cls), true, transient, true);
    EXPECT_TRUE(made.has_value()) << identifier << ": code " << (made ? 1 : made.error());
    return made ? *made : nullptr;
}

bool CreateFixture::cached(const QRNContainerIdentityPtr& identity, bool transient) {
    return QRNContainerCache::sharedInstance()
        .containerForContainerIdentity(identity, transient)
        .has_value();
}

std::filesystem::path CreateFixture::classDirectory(std::uint64_t cls, bool transient) {
    return *QRNGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
        user(), cls, transient);
}

std::filesystem::path CreateFixture::stagingDirectory(std::uint64_t cls) {
    return *QRNGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(user(),
                                                                                        cls);
}

std::filesystem::path CreateFixture::deathRow() {
    return QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
}

std::vector<std::string> CreateFixture::namesIn(const std::filesystem::path& directory) {
    std::vector<std::string> names;
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(directory, ec)) {
        names.push_back(entry.path().filename().string());
    }
    std::sort(names.begin(), names.end());
    return names;
}

std::vector<std::string> CreateFixture::namesOnDeathRow() {
    std::vector<std::string> names;
    for (const std::string& unique : namesIn(deathRow())) {
        for (const std::string& name : namesIn(deathRow() / unique)) {
            names.push_back(name);
        }
    }
    std::sort(names.begin(), names.end());
    return names;
}

std::filesystem::path CreateFixture::makeTree(const std::filesystem::path& directory) {
    std::filesystem::create_directories(directory / "inner");
    std::ofstream(directory / "inner" / "file") << "x";
    return directory;
}

void CreateFixture::drainBackground() {
    QRNClientConnection::_sharedBackgroundQueue()->sync([] {});
    QRNClientConnection::_sharedDeathrowBackgroundQueue()->sync([] {});
}

std::uint64_t CreateFixture::totalCalls() const {
    std::uint64_t total = 0;
    for (std::size_t call = 0; call < static_cast<std::size_t>(EnvCall::Count_); ++call) {
        total += env_->count(static_cast<EnvCall>(call));
    }
    return total;
}

struct stat CreateFixture::lstatOf(const std::filesystem::path& path) {
    struct stat st {};
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    return st;
}

void CreateFixture::primeDirectories(std::uint64_t cls, bool transient) {
    classDirectory(cls, transient);
    stagingDirectory(cls);
    deathRow();
    // Builds the cache entry of the class, so no listing happens later.
    auto absent = privileged()->createOrLookupContainerWithContainerIdentity(
        identity("com.example.absent", cls), false, false, true);
    ASSERT_FALSE(absent.has_value());
    ASSERT_EQ(absent.error(), kQRNErrorContainerNotFound);
}

} // namespace quarn::test
