#pragma once
// A temporary root whose file manager runs on a fault-injecting Env, with
// helpers to make client connections and identities and to look at what the
// operations left on disk.

#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/support/PropertyList.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <thread>

namespace quarn::test {

inline constexpr const char* kClientBundle = "com.example.client";

// A fork of this process (same executable, another audit token) that execs
// `sleep` when told, and is killed when reaped.
class ForkedChild {
public:
    static constexpr const char* kSleep = "/usr/bin/sleep";
    ForkedChild() {
        EXPECT_EQ(::pipe(pipe_), 0);
        if ((pid_ = ::fork()) == 0) {
            ::close(pipe_[1]);
            char byte = 0;
            if (::read(pipe_[0], &byte, 1) == 1) {
                ::execl(kSleep, kSleep, "60", nullptr);
            }
            ::_exit(0);
        }
        ::close(pipe_[0]);
    }
    ~ForkedChild() { reap(); }
    pid_t pid() const { return pid_; }
    void exec() {
        ASSERT_EQ(::write(pipe_[1], "x", 1), 1);
        const auto exe = "/proc/" + std::to_string(pid_) + "/exe";
        std::error_code error;
        for (int i = 0; i < 2000 && std::filesystem::read_symlink(exe, error) != kSleep; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        ASSERT_EQ(std::filesystem::read_symlink(exe, error), kSleep);
    }
    void reap() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
            ::close(pipe_[1]);
            ::waitpid(pid_, nullptr, 0);
            pid_ = -1;
        }
    }

private:
    int pipe_[2] = {-1, -1};
    pid_t pid_ = -1;
};

class CreateFixture : public ::testing::Test {
protected:
    using Path = std::filesystem::path;

    // Unless `holdDeathRow` is false, death row keeps what it receives until
    // the fixture ends, so tests can look at it.
    explicit CreateFixture(bool holdDeathRow = true) : holdDeathRow_(holdDeathRow) {
        // Before anything makes the file manager, which takes the Env once.
        root_.context().install<Env>(env_);
        if (holdDeathRow_) {
            QRNClientConnection::_sharedDeathrowBackgroundQueue()->suspend();
        }
    }
    ~CreateFixture() override {
        env_->clearFailures();
        env_->setHook(nullptr);
        // Let the deletion passes run to their end while the root still exists.
        if (holdDeathRow_) {
            QRNClientConnection::_sharedDeathrowBackgroundQueue()->resume();
        }
        drainBackground();
    }

    static QRNClientIdentityPtr clientIdentity(const std::string& bundle,
                                               Value entitlements = Value::dictionary()) {
        return QRNClientIdentity::initWithBundleIdentifier(bundle, kMobileUID, kMobileUID, 4242,
                                                           user(), std::move(entitlements), false,
                                                           QRNClientIdentity::AuditToken{}, false);
    }
    std::shared_ptr<QRNClientConnection> connectionFor(const std::string& bundle,
                                                       bool otherIds = false,
                                                       std::optional<Value> lookup = {},
                                                       bool unrestricted = false) {
        return std::make_shared<QRNClientConnection>(clientIdentity(bundle), unrestricted, otherIds,
                                                     unrestricted, lookup, std::nullopt, nullptr);
    }
    std::shared_ptr<QRNClientConnection> privileged() {
        return connectionFor(kClientBundle, false, {}, true);
    }
    // Registers this test program with the code-signing registry.
    void registerSelf(const std::string& identifier, std::optional<Value> entitlements,
                      bool sandboxed = false) {
        Value plist = dictionaryOf(
            {{"Program", Value(std::filesystem::read_symlink("/proc/self/exe").string())},
             {"Identifier", Value(identifier)},
             {"Sandboxed", Value(sandboxed)}});
        if (entitlements) {
            plist.set("Entitlements", *entitlements);
        }
        std::filesystem::create_directories(root_ / "/etc/quarnd/codesign.d");
        ASSERT_TRUE(
            QRN_writeToURL(plist, root_ / "/etc/quarnd/codesign.d/self.plist", {.atomic = true}));
    }
    static QRNClientConnection& shared() { return QRNClientConnection::sharedClientConnection(); }
    static QRNGlobalConfiguration& configuration() {
        return QRNGlobalConfiguration::sharedInstance();
    }
    static QRNUserIdentityPtr user() {
        return QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity();
    }
    static QRNContainerIdentityPtr identity(const std::string& identifier, std::uint64_t cls) {
        auto made =
            QRNContainerIdentity::containerIdentityWithUserIdentity(user(), identifier, cls);
        EXPECT_TRUE(made.has_value());
        return made ? *made : nullptr;
    }
    // Creates (or finds) with an unrestricted connection; fails the test on error.
    QRNMetadataPtr create(const std::string& identifier, std::uint64_t cls,
                          bool transient = false) {
        auto made = privileged()->createOrLookupContainerWithContainerIdentity(
            identity(identifier, cls), true, transient, true);
        EXPECT_TRUE(made.has_value()) << identifier << ": code " << (made ? 1 : made.error());
        return made ? *made : nullptr;
    }
    static bool cached(const QRNContainerIdentityPtr& identity, bool transient = false) {
        return QRNContainerCache::sharedInstance()
            .containerForContainerIdentity(identity, transient)
            .has_value();
    }
    static bool cached(const std::string& identifier, std::uint64_t cls) {
        return cached(identity(identifier, cls));
    }

    static Path classDirectory(std::uint64_t cls, bool transient = false) {
        return *configuration().containerDirectoryURLForUserIdentity(user(), cls, transient);
    }
    static Path stagingDirectory(std::uint64_t cls) {
        return *configuration().stagingDirectoryURLForUserIdentity(user(), cls);
    }
    static Path deathRow() { return configuration().deathrowDirectory(); }
    // Names directly inside a directory (dot files included); empty when missing.
    static std::vector<std::string> namesIn(const Path& directory) {
        std::vector<std::string> names;
        std::error_code ec;
        for (const auto& entry : std::filesystem::directory_iterator(directory, ec)) {
            names.push_back(entry.path().filename().string());
        }
        std::sort(names.begin(), names.end());
        return names;
    }
    // Every item below death row's unique directories, by last component.
    static std::vector<std::string> namesOnDeathRow() {
        std::vector<std::string> names;
        for (const std::string& unique : namesIn(deathRow())) {
            for (const std::string& name : namesIn(deathRow() / unique)) {
                names.push_back(name);
            }
        }
        std::sort(names.begin(), names.end());
        return names;
    }
    // A directory holding a subdirectory with a file.
    static Path makeTree(const Path& directory) {
        std::filesystem::create_directories(directory / "inner");
        std::ofstream(directory / "inner" / "file") << "x";
        return directory;
    }
    // Waits for the background passes queued so far.
    static void drainBackground() {
        QRNClientConnection::_sharedBackgroundQueue()->sync([] {});
        QRNClientConnection::_sharedDeathrowQueue()->sync([] {});
        QRNClientConnection::_sharedDeathrowBackgroundQueue()->sync([] {});
    }
    static struct stat lstatOf(const Path& path) {
        struct stat st {};
        EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
        return st;
    }

    const bool holdDeathRow_;
    TempRoot root_;
    std::shared_ptr<FaultInjectingEnv> env_ =
        std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
};

} // namespace quarn::test
