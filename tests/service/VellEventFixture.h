#pragma once
// A temporary root on which requests go through the request protocol as a
// client connection delivers them: a fake connection records the replies
// and the cancel, a fake code-signing registry says who the client is, a
// fake extension issuer records the tokens asked for, and a mapping with
// group records stands in for the code-signing database.

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/platform/IpcConnection.h"
#include "Daemon/platform/SandboxExtensions.h"

#include "common/TempRoot.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <initializer_list>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace quarn::test {

inline constexpr const char* kVellClient = "com.example.vellclient";

class FakeIpcConnection : public IpcConnection {
public:
    FakeIpcConnection();
    const IpcPeer& peer() const override { return peer_; }
    void setEventHandler(EventHandler) override {}
    void resume() override {}
    void sendReply(const Value& reply) override {
        std::lock_guard guard(mutex_);
        replies_.push_back(reply);
    }
    void cancel() override {
        std::lock_guard guard(mutex_);
        cancelled_ = true;
    }
    std::vector<Value> replies() const {
        std::lock_guard guard(mutex_);
        return replies_;
    }
    bool cancelled() const {
        std::lock_guard guard(mutex_);
        return cancelled_;
    }

private:
    IpcPeer peer_;
    // Guards replies_ and cancelled_: asynchronous replies come from other threads.
    mutable std::mutex mutex_;
    std::vector<Value> replies_;
    bool cancelled_ = false;
};

class FakeCodeSigningRegistry : public CodeSigningRegistry {
public:
    std::optional<CodeSigningInfo> infoForAuditToken(const IpcPeer::AuditToken&) override {
        return info;
    }
    std::optional<CodeSigningInfo> info;
};

class FakeSandboxExtensions : public SandboxExtensions {
public:
    struct Issued {
        std::string extensionClass;
        std::string path;
        IpcPeer::AuditToken token;
    };
    Result<std::string> issueFileExtension(std::string_view extensionClass, std::string_view path,
                                           const IpcPeer::AuditToken& token) override;
    std::vector<Issued> issued;
    bool failing = false;
};

// Group records by owner, as the code-signing database would hold them.
class RecordedGroupsMapping : public QRNCodeSigningMapping {
public:
    using QRNCodeSigningMapping::QRNCodeSigningMapping;
    std::optional<Value> appGroupIdentifiersForIdentifier(std::string_view identifier) override;
    std::optional<Value> systemGroupIdentifiersForIdentifier(std::string_view identifier) override;
    using Records = std::map<std::string, Value, std::less<>>;
    Records appGroups;
    Records systemGroups;
    // Called at each query, for a test to look at what holds then.
    std::function<void()> onQuery;

private:
    std::optional<Value> recorded(const Records& records, std::string_view identifier) const;
};

// An event of `kind` from the connection's peer.
IpcConnection::Event eventOf(IpcConnection::Event::Kind kind, Value body, bool expectsReply);

class VellEventFixture : public ::testing::Test {
protected:
    VellEventFixture();
    ~VellEventFixture() override;

    // The client the registry reports from now on.
    void setClient(const std::string& identifier, Value entitlements, bool sandboxed = false);
    void setUnknownClient() { registry_->info.reset(); }

    // Delivers one request with a reply context; answers every reply sent
    // on the connection so far for it.
    std::vector<Value> dispatch(const Value& request);
    // The one reply a request must get.
    Value send(const Value& request);

    QRNUserIdentityPtr user() const;
    // Creates (or finds) a container with every right.
    QRNMetadataPtr create(const std::string& identifier, std::uint64_t cls);
    // Whether the cache still knows the container.
    bool cached(const std::string& identifier, std::uint64_t cls);
    // Waits for the background deletion passes started so far.
    static void drainDeathRow();

    TempRoot root_;
    std::shared_ptr<FakeIpcConnection> connection_ = std::make_shared<FakeIpcConnection>();
    std::shared_ptr<FakeCodeSigningRegistry> registry_ =
        std::make_shared<FakeCodeSigningRegistry>();
    std::shared_ptr<FakeSandboxExtensions> extensions_ = std::make_shared<FakeSandboxExtensions>();
    std::shared_ptr<RecordedGroupsMapping> mapping_;
};

} // namespace quarn::test
