#pragma once
// A temporary root on which requests go through the request protocol as a
// client connection delivers them: a fake connection records the replies
// and the cancel, a fake code-signing registry says who the client is, a
// fake extension issuer records the tokens asked for, and a mapping with
// group records stands in for the code-signing database.

#include "operations/CreateFixture.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/platform/IpcConnection.h"
#include "Daemon/platform/SandboxExtensions.h"
#include "Daemon/service/QRNVellEvent.h"

#include <atomic>
#include <functional>
#include <map>
#include <mutex>

namespace quarn::test {

inline constexpr const char* kVellClient = "com.example.vellclient";

// Records replies and the cancel; the writer of the current message is
// `sender`, the peer's own process when none.
class FakeIpcConnection : public IpcConnection {
public:
    FakeIpcConnection() = default;
    explicit FakeIpcConnection(IpcPeer peer) : peer_(std::move(peer)) {}
    const IpcPeer& peer() const override { return peer_; }
    std::optional<Sender> messageSender() const override { return sender; }
    bool runsSameProgram() const override { return sameProgram; }
    void setEventHandler(EventHandler) override {}
    void resume() override {}
    void sendReply(const Value& reply) override {
        std::lock_guard guard(mutex_);
        replies_.push_back(reply);
    }
    void cancel() override { cancelled = true; }
    std::vector<Value> replies() const {
        std::lock_guard guard(mutex_);
        return replies_;
    }
    std::atomic<bool> cancelled{false};
    std::optional<Sender> sender;
    std::atomic<bool> sameProgram{true};

private:
    IpcPeer peer_{
        getpid(),   kMobileUID,
        kMobileUID, IpcPeer::makeAuditToken({.euid = kMobileUID, .pid = 4242, .startTime = 99}),
        99,         nullptr};
    // Guards replies_: asynchronous replies come from other threads.
    mutable std::mutex mutex_;
    std::vector<Value> replies_;
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
    Result<std::string> issueFileExtension(std::string_view extensionClass, std::string_view path,
                                           const IpcPeer::AuditToken& token) override {
        if (failing) {
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(EPERM, "refused"));
        }
        tokens.push_back(token);
        return "token:" + std::string(extensionClass) + ":" + std::string(path);
    }
    std::vector<IpcPeer::AuditToken> tokens; // of every extension issued
    bool failing = false;
};

// Group records by owner, as the code-signing database would hold them.
class RecordedGroupsMapping : public QRNCodeSigningMapping {
public:
    using QRNCodeSigningMapping::QRNCodeSigningMapping;
    std::optional<Value> appGroupIdentifiersForIdentifier(std::string_view owner) override {
        return recorded(appGroups, owner);
    }
    std::optional<Value> systemGroupIdentifiersForIdentifier(std::string_view owner) override {
        return recorded(systemGroups, owner);
    }
    std::map<std::string, Value, std::less<>> appGroups, systemGroups;
    // Called at each query, for a test to look at what holds then.
    std::function<void()> onQuery = [] {};

private:
    std::optional<Value> recorded(const auto& records, std::string_view owner) const {
        onQuery();
        auto found = records.find(owner);
        return found == records.end() ? std::nullopt : std::optional<Value>(found->second);
    }
};

class VellEventFixture : public CreateFixture {
protected:
    VellEventFixture() : CreateFixture(false) {
        root_.context().install<CodeSigningRegistry>(registry_);
        root_.context().install<SandboxExtensions>(extensions_);
        root_.context().install<QRNCodeSigningMapping>(mapping_);
        setClient(kVellClient, Value::dictionary());
    }

    // The client the registry reports from now on.
    void setClient(const std::string& identifier, Value entitlements) {
        registry_->info = CodeSigningInfo{identifier, std::move(entitlements), false};
    }
    static Value allowed() {
        return dictionaryOf({{"com.orvex.private.Quarn.allowed", Value(true)}});
    }
    // Delivers one request with a reply context; answers every reply sent
    // on the connection for it.
    std::vector<Value> dispatch(const Value& request) {
        const std::size_t before = connection_->replies().size();
        QRNProcessVellEvent(connection_, {IpcConnection::Event::Kind::Message, request, true});
        std::vector<Value> replies = connection_->replies();
        return {replies.begin() + static_cast<std::ptrdiff_t>(before), replies.end()};
    }
    // The one reply a request must get.
    Value send(const Value& request) {
        std::vector<Value> replies = dispatch(request);
        EXPECT_EQ(replies.size(), 1u) << request.description();
        return replies.empty() ? Value() : replies.back();
    }
    std::uint64_t codeOf(const Value& request) { return replyError(send(request)); }

    std::shared_ptr<FakeIpcConnection> connection_ = std::make_shared<FakeIpcConnection>();
    std::shared_ptr<FakeCodeSigningRegistry> registry_ =
        std::make_shared<FakeCodeSigningRegistry>();
    std::shared_ptr<FakeSandboxExtensions> extensions_ = std::make_shared<FakeSandboxExtensions>();
    std::shared_ptr<RecordedGroupsMapping> mapping_ =
        std::make_shared<RecordedGroupsMapping>(root_.context());
};

} // namespace quarn::test
