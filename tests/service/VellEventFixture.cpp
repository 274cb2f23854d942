#include "VellEventFixture.h"

#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/service/QRNVellEvent.h"
#include "Daemon/support/Queue.h"

#include <unistd.h>

namespace quarn::test {

IpcConnection::Event eventOf(IpcConnection::Event::Kind kind, Value body, bool expectsReply) {
    IpcConnection::Event event;
    event.kind = kind;
    event.body = std::move(body);
    event.expectsReply = expectsReply;
    return event;
}

FakeIpcConnection::FakeIpcConnection()
    : peer_(getpid(), kMobileUID, kMobileUID,
            IpcPeer::makeAuditToken({.euid = kMobileUID, .pid = 4242, .startTime = 99}), 99,
            nullptr) {}

Result<std::string> FakeSandboxExtensions::issueFileExtension(std::string_view extensionClass,
                                                              std::string_view path,
                                                              const IpcPeer::AuditToken& token) {
    if (failing) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EPERM, "refused"));
    }
    issued.push_back({std::string(extensionClass), std::string(path), token});
    return "token:" + std::string(extensionClass) + ":" + std::string(path);
}

std::optional<Value>
RecordedGroupsMapping::appGroupIdentifiersForIdentifier(std::string_view identifier) {
    return recorded(appGroups, identifier);
}

std::optional<Value>
RecordedGroupsMapping::systemGroupIdentifiersForIdentifier(std::string_view identifier) {
    return recorded(systemGroups, identifier);
}

std::optional<Value> RecordedGroupsMapping::recorded(const Records& records,
                                                     std::string_view identifier) const {
    if (onQuery) {
        onQuery();
    }
    auto found = records.find(identifier);
    return found == records.end() ? std::nullopt : std::optional<Value>(found->second);
}

VellEventFixture::VellEventFixture()
    : mapping_(std::make_shared<RecordedGroupsMapping>(root_.context())) {
    QRNDaemonContext& context = root_.context();
    context.install<CodeSigningRegistry>(registry_);
    context.install<SandboxExtensions>(extensions_);
    context.install<QRNCodeSigningMapping>(mapping_);
    setClient(kVellClient, Value::dictionary());
}

VellEventFixture::~VellEventFixture() {
    drainDeathRow();
}

void VellEventFixture::setClient(const std::string& identifier, Value entitlements,
                                 bool sandboxed) {
    registry_->info = CodeSigningInfo{identifier, std::move(entitlements), sandboxed};
}

std::vector<Value> VellEventFixture::dispatch(const Value& request) {
    const std::size_t before = connection_->replies().size();
    QRNProcessVellEvent(connection_, eventOf(IpcConnection::Event::Kind::Message, request, true));
    std::vector<Value> replies = connection_->replies();
    return {replies.begin() + static_cast<std::ptrdiff_t>(before), replies.end()};
}

Value VellEventFixture::send(const Value& request) {
    std::vector<Value> replies = dispatch(request);
    EXPECT_EQ(replies.size(), 1u) << request.description();
    return replies.empty() ? Value() : replies.back();
}

QRNUserIdentityPtr VellEventFixture::user() const {
    return QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity();
}

QRNMetadataPtr VellEventFixture::create(const std::string& identifier, std::uint64_t cls) {
    auto identity =
        QRNContainerIdentity::containerIdentityWithUserIdentity(user(), identifier, cls);
    EXPECT_TRUE(identity.has_value());
    auto made = QRNClientConnection::privilegedClientConnectionWithUserIdentity(user())
                    ->createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
    EXPECT_TRUE(made.has_value()) << "code " << (made ? 1 : made.error());
    return made ? *made : nullptr;
}

bool VellEventFixture::cached(const std::string& identifier, std::uint64_t cls) {
    auto identity =
        QRNContainerIdentity::containerIdentityWithUserIdentity(user(), identifier, cls);
    return identity && QRNContainerCache::sharedInstance().containerForContainerIdentity(*identity);
}

void VellEventFixture::drainDeathRow() {
    QRNClientConnection::_sharedDeathrowQueue()->sync([] {});
    QRNClientConnection::_sharedDeathrowBackgroundQueue()->sync([] {});
}

} // namespace quarn::test
