#include "VellEventFixture.h"

#include "Daemon/QRNVellEvent.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/Queue.h"

#include <unistd.h>

namespace quarn::test {

Value dictionaryOf(std::initializer_list<std::pair<const char*, Value>> entries) {
    Value dictionary = Value::dictionary();
    for (const auto& [key, value] : entries) {
        dictionary.set(key, value);
    }
    return dictionary;
}

Value arrayOf(std::initializer_list<Value> items) {
    return Value(Value::Array(items));
}

std::uint64_t replyError(const Value& reply) {
    const Value* error = reply.get("ReplyError");
    return error ? error->asUInt64().value_or(0) : 0;
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
    if (onQuery) {
        onQuery();
    }
    auto found = appGroups.find(identifier);
    return found == appGroups.end() ? std::nullopt : std::optional<Value>(found->second);
}

std::optional<Value>
RecordedGroupsMapping::systemGroupIdentifiersForIdentifier(std::string_view identifier) {
    if (onQuery) {
        onQuery();
    }
    auto found = systemGroups.find(identifier);
    return found == systemGroups.end() ? std::nullopt : std::optional<Value>(found->second);
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
    QRNProcessVellEvent(connection_, {IpcConnection::Event::Kind::Message, request, true});
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
