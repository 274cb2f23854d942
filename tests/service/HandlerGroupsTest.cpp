// Group and system group commands, and the sandbox tokens that replies
// carry for sandboxed clients of enterprise personas.

#include "VellEventFixture.h"

#include "Daemon/codesigning/QRNGroupManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNLocks.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/service/QRNCommandHandlers.h"
#include "Daemon/service/QRNCommandTable.h"
#include "Daemon/service/QRNVellReply.h"

using namespace quarn;
using namespace quarn::test;

namespace {

class HandlerGroupsTest : public VellEventFixture {
protected:
    static Value groupRequest(std::uint64_t command, const std::string& name,
                              const char* key = "Identifier") {
        return dictionaryOf({{"Command", Value(command)}, {key, Value(name)}});
    }
    // The path of `group` in a reply's "ReplyGroupContainerDict", or its
    // "ReplyPath" when `group` is null; empty when missing.
    static std::filesystem::path pathIn(const Value& reply, const char* group = nullptr) {
        const Value* paths = group ? reply.get("ReplyGroupContainerDict") : &reply;
        const Value* path = paths ? paths->get(group ? group : "ReplyPath") : nullptr;
        return path && path->asString() ? *path->asString() : std::string();
    }
};

TEST_F(HandlerGroupsTest,
       GroupsAndSystemGroupsOfAnOwnerAreMadeUnderTheGlobalWriteLockSkippingBadOnes) {
    const Value identifiers = groupRequest(14, "ignored");
    setClient(kVellClient, allowed());
    EXPECT_EQ(*send(identifiers).get("ReplyGroupIdentifiersArray"), Value::array());
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a"), Value(3u), Value("group.b")});
    EXPECT_EQ(*send(identifiers).get("ReplyGroupIdentifiersArray"),
              arrayOf({Value("group.a"), Value("group.b")}));
    mapping_->appGroups[kVellClient] = Value("group.a");
    EXPECT_EQ(codeOf(identifiers), 11u);
    EXPECT_EQ(QRNGroupManager::defaultManager()
                  .groupContainerIdentifiersForOwnerIdentifier("", 7)
                  .error(),
              11u);

    // Its lookups take no lock of their own, so two requests that reach the
    // same new group at once would each create one.
    setClient(kVellClient, Value::dictionary());
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a"), Value(""), Value("group.b")});
    std::vector<std::int32_t> states;
    mapping_->onQuery = [&] {
        states.push_back(QRNLocks::shared().snapshot().allReaderWriterState);
    };
    Value reply = send(groupRequest(13, kVellClient));
    mapping_->onQuery = [] {};
    EXPECT_EQ(states, std::vector<std::int32_t>{-1});
    EXPECT_EQ(QRNLocks::shared().snapshot().allReaderWriterState, 0);
    EXPECT_EQ(reply.get("ReplyGroupContainerDict")->size(), 2u) << reply.description();
    EXPECT_TRUE(std::filesystem::is_directory(pathIn(reply, "group.a")));
    EXPECT_TRUE(cached("group.b", kQRNContainerClassAppGroup));
    EXPECT_EQ(reply.get("ReplySandboxTokenDict"), nullptr);

    // Another owner's groups need a lookup grant.
    mapping_->appGroups["com.example.owner"] = arrayOf({Value("group.o")});
    EXPECT_EQ(codeOf(groupRequest(13, "com.example.owner")), 55u);
    EXPECT_FALSE(cached("group.o", kQRNContainerClassAppGroup));
    setClient(
        kVellClient,
        dictionaryOf({{"com.orvex.private.Quarn.lookup",
                       dictionaryOf({{"appGroup", arrayOf({Value("com.example.owner")})}})}}));
    EXPECT_FALSE(pathIn(send(groupRequest(13, "com.example.owner")), "group.o").empty());

    // System groups of an owner, and one by entitlement or when open to all.
    mapping_->systemGroups[kVellClient] = arrayOf({Value("systemgroup.com.example.one")});
    EXPECT_EQ(pathIn(send(groupRequest(16, kVellClient)), "systemgroup.com.example.one")
                  .parent_path()
                  .parent_path()
                  .filename(),
              "Shared");
    auto one = [](const char* group) { return groupRequest(17, group, "GroupIdentifier"); };
    EXPECT_TRUE(
        std::filesystem::is_directory(pathIn(send(one("systemgroup.com.orvex.sharedpclogging")))));
    EXPECT_EQ(pathIn(send(one("systemgroup.com.orvex.pairing"))).filename(),
              "systemgroup.com.orvex.pairing");
    EXPECT_EQ(codeOf(one("systemgroup.com.example.secret")), 55u);
    mapping_->systemGroups[kVellClient] = arrayOf({Value("systemgroup.com.example.secret")});
    EXPECT_FALSE(pathIn(send(one("systemgroup.com.example.secret"))).empty());
    EXPECT_EQ(codeOf(dictionaryOf({{"Command", Value(17u)}})), 18u);
}

// Tokens: handlers run directly, since a client's persona comes from its
// connection only in the default persona.
class SandboxTokenTest : public VellEventFixture {
protected:
    QRNUserIdentityPtr enterprise() const {
        return QRNUserIdentity::initWithUID(kMobileUID, kMobileUID, root_ / "/private/var/ent",
                                            std::string("P-ENT"), kQRNPersonaTypeEnterprise, 1001);
    }
    std::shared_ptr<QRNClientConnection> client(QRNUserIdentityPtr persona, bool sandboxed) {
        QRNClientIdentity::AuditToken token{};
        token[0] = 0xAB;
        auto identity = QRNClientIdentity::initWithBundleIdentifier(
            kVellClient, kMobileUID, kMobileUID, 9, std::move(persona), Value::dictionary(),
            sandboxed, token, false);
        return std::make_shared<QRNClientConnection>(identity, false, false, false, std::nullopt,
                                                     std::nullopt, nullptr);
    }
    Value run(QRNCommandHandler handler, const Value& request, QRNClientConnection& client,
              std::uint64_t expected = 1) {
        QRNVellReply reply(nullptr);
        std::uint64_t error = 1;
        handler(request, reply, client, error);
        EXPECT_EQ(error, expected) << request.description();
        return reply.dictionary();
    }
    Value createIn(std::uint64_t cls, QRNClientConnection& client) {
        return run(
            &QRNCommandHandlers::createOrLookupContainer,
            dictionaryOf({{"ContainerClass", Value(cls)}, {"CreateIfNecessary", Value(true)}}),
            client);
    }
};

TEST_F(SandboxTokenTest, OnlySandboxedEnterpriseClientsGetTokensAndPersonas) {
    auto sandboxed = client(enterprise(), true);
    Value data = createIn(2, *sandboxed);
    const std::string path = *data.get("ReplyPath")->asString();
    const std::string devicePath = Paths(root_.path()).devicePath(path);
    ASSERT_NE(devicePath, path);
    EXPECT_EQ(*data.get("ReplySandboxToken"),
              Value("token:com.orvex.sandbox.container:" + devicePath));
    EXPECT_EQ(*data.get("ReplyPersonaUniqueString"), Value("P-ENT"));
    ASSERT_EQ(extensions_->tokens.size(), 1u);
    EXPECT_EQ(extensions_->tokens[0][0], 0xAB);

    // A class without an extension class, the same persona unsandboxed, and
    // a sandboxed client of the personal persona get none.
    EXPECT_EQ(createIn(9, *sandboxed).get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(createIn(2, *client(enterprise(), false)).get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(createIn(2, *client(user(), true)).get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(extensions_->tokens.size(), 1u);

    // Group replies carry token and persona dictionaries only when not empty.
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a")});
    const Value request = dictionaryOf({{"Identifier", Value(kVellClient)}});
    Value groups = run(&QRNCommandHandlers::groupContainersForOwner, request, *sandboxed);
    ASSERT_TRUE(groups.get("ReplySandboxTokenDict")) << groups.description();
    EXPECT_TRUE(groups.get("ReplySandboxTokenDict")
                    ->get("group.a")
                    ->asString()
                    ->starts_with("token:com.orvex.sandbox.application-group:"));
    EXPECT_EQ(*groups.get("ReplyPersonaUniqueStringDict"),
              dictionaryOf({{"group.a", Value("P-ENT")}}));
    Value personal =
        run(&QRNCommandHandlers::groupContainersForOwner, request, *client(user(), true));
    EXPECT_EQ(personal.get("ReplyGroupContainerDict")->size(), 1u);
    EXPECT_EQ(personal.get("ReplySandboxTokenDict"), nullptr);
    EXPECT_EQ(personal.get("ReplyPersonaUniqueStringDict"), nullptr);

    extensions_->failing = true;
    EXPECT_EQ(createIn(2, *sandboxed).get("ReplySandboxToken"), nullptr);

    // Clients without a persona keep their own when none holds the bundle.
    auto unspecific =
        client(QRNUserIdentity::initWithUID(kMobileUID, kMobileUID, root_ / "/private/var/mobile",
                                            std::nullopt, kQRNPersonaTypeUnspecific, kMobileUID),
               false);
    LogCapture log;
    auto chosen = unspecific->userIdentityForContainerIdentifier("com.example.x", 2);
    ASSERT_TRUE(chosen.has_value());
    EXPECT_EQ(*chosen, unspecific->userIdentity());
    EXPECT_TRUE(
        log.contains("com.example.vellclient trying to look up persona for 2:com.example.x"))
        << log.all();
    // Group owners must be found in a persona.
    run(&QRNCommandHandlers::groupContainersForOwner,
        dictionaryOf({{"Identifier", Value("com.example.x")}}), *unspecific, 76);
    // Classes that are not data classes never choose.
    log.clear();
    EXPECT_EQ(*unspecific->userIdentityForContainerIdentifier("com.example.x", 1),
              unspecific->userIdentity());
    EXPECT_FALSE(log.contains("trying to look up persona"));
}

} // namespace
