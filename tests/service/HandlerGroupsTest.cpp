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

#include "common/LogCapture.h"

#include <filesystem>

using namespace quarn;
using namespace quarn::test;

namespace {

class HandlerGroupsTest : public VellEventFixture {
protected:
    static Value groupRequest(std::uint64_t command, const char* key, const std::string& name) {
        return dictionaryOf({{"Command", Value(command)}, {key, Value(name)}});
    }
    static std::filesystem::path pathIn(const Value& reply, const char* key, const char* group) {
        const Value* paths = reply.get(key);
        const Value* path = paths ? paths->get(group) : nullptr;
        return path && path->asString() ? *path->asString() : std::string();
    }
};

TEST_F(HandlerGroupsTest, GroupIdentifiersOfTheClientFromItsRecord) {
    setClient(kVellClient, dictionaryOf({{"com.orvex.private.Quarn.allowed", Value(true)}}));
    EXPECT_EQ(*send(groupRequest(14, "Identifier", "ignored")).get("ReplyGroupIdentifiersArray"),
              Value::array());
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a"), Value(3u), Value("group.b")});
    EXPECT_EQ(*send(groupRequest(14, "Identifier", "ignored")).get("ReplyGroupIdentifiersArray"),
              arrayOf({Value("group.a"), Value("group.b")}));
    mapping_->appGroups[kVellClient] = Value("group.a");
    EXPECT_EQ(replyError(send(groupRequest(14, "Identifier", "ignored"))), 11u);
    EXPECT_EQ(QRNGroupManager::defaultManager()
                  .groupContainerIdentifiersForOwnerIdentifier("", 7)
                  .error(),
              11u);
}

TEST_F(HandlerGroupsTest, GroupContainersOfAnOwnerSkipTheOnesThatCannotBeMade) {
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a"), Value(""), Value("group.b")});
    Value reply = send(groupRequest(13, "Identifier", kVellClient));
    ASSERT_EQ(replyError(reply), 1u) << reply.description();
    EXPECT_EQ(reply.get("ReplyGroupContainerDict")->size(), 2u);
    EXPECT_TRUE(std::filesystem::is_directory(pathIn(reply, "ReplyGroupContainerDict", "group.a")));
    EXPECT_TRUE(cached("group.b", kQRNContainerClassAppGroup));
    EXPECT_EQ(reply.get("ReplySandboxTokenDict"), nullptr);
}

TEST_F(HandlerGroupsTest, AnOwnersGroupsAreFoundAndMadeUnderTheGlobalWriteLock) {
    // Its lookups take no lock of their own, so two requests that reach the
    // same new group at once would each create one.
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a")});
    std::vector<std::int32_t> states;
    mapping_->onQuery = [&states] {
        states.push_back(QRNLocks::shared().snapshot().allReaderWriterState);
    };
    ASSERT_EQ(replyError(send(groupRequest(13, "Identifier", kVellClient))), 1u);
    EXPECT_EQ(states, std::vector<std::int32_t>{-1});
    EXPECT_EQ(QRNLocks::shared().snapshot().allReaderWriterState, 0);
}

TEST_F(HandlerGroupsTest, AnotherOwnersGroupsNeedALookupGrant) {
    mapping_->appGroups["com.example.owner"] = arrayOf({Value("group.o")});
    EXPECT_EQ(replyError(send(groupRequest(13, "Identifier", "com.example.owner"))), 55u);
    EXPECT_FALSE(cached("group.o", kQRNContainerClassAppGroup));
    setClient(
        kVellClient,
        dictionaryOf({{"com.orvex.private.Quarn.lookup",
                       dictionaryOf({{"appGroup", arrayOf({Value("com.example.owner")})}})}}));
    Value reply = send(groupRequest(13, "Identifier", "com.example.owner"));
    EXPECT_FALSE(pathIn(reply, "ReplyGroupContainerDict", "group.o").empty())
        << reply.description();
}

TEST_F(HandlerGroupsTest, SystemGroupsOfAnOwner) {
    mapping_->systemGroups[kVellClient] = arrayOf({Value("systemgroup.com.example.one")});
    Value reply = send(groupRequest(16, "Identifier", kVellClient));
    std::filesystem::path path =
        pathIn(reply, "ReplyGroupContainerDict", "systemgroup.com.example.one");
    EXPECT_EQ(path.parent_path().parent_path().filename(), "Shared") << reply.description();
}

TEST_F(HandlerGroupsTest, OneSystemGroupByEntitlementOrWhenOpenToAll) {
    const char* key = "GroupIdentifier";
    Value logging = send(groupRequest(17, key, "systemgroup.com.orvex.sharedpclogging"));
    EXPECT_EQ(replyError(logging), 1u) << logging.description();
    EXPECT_TRUE(std::filesystem::is_directory(*logging.get("ReplyPath")->asString()));

    Value wellknown = send(groupRequest(17, key, "systemgroup.com.orvex.pairing"));
    ASSERT_EQ(replyError(wellknown), 1u);
    EXPECT_EQ(std::filesystem::path(*wellknown.get("ReplyPath")->asString()).filename(),
              "systemgroup.com.orvex.pairing");

    LogCapture log;
    EXPECT_EQ(replyError(send(groupRequest(17, key, "systemgroup.com.example.secret"))), 55u);
    EXPECT_TRUE(log.contains("com.example.vellclient is not entitled for system group identifier: "
                             "systemgroup.com.example.secret.  Only entitled for: []"))
        << log.all();

    mapping_->systemGroups[kVellClient] = arrayOf({Value("systemgroup.com.example.secret")});
    Value entitled = send(groupRequest(17, key, "systemgroup.com.example.secret"));
    EXPECT_EQ(replyError(entitled), 1u);
    EXPECT_TRUE(entitled.get("ReplyPath"));
    EXPECT_EQ(replyError(send(dictionaryOf({{"Command", Value(17u)}}))), 18u);
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
    static Value create(std::uint64_t cls) {
        return dictionaryOf({{"ContainerClass", Value(cls)}, {"CreateIfNecessary", Value(true)}});
    }
};

TEST_F(SandboxTokenTest, OnlySandboxedEnterpriseClientsGetTokens) {
    LogCapture log;
    auto sandboxed = client(enterprise(), true);
    Value data = run(&QRNCommandHandlers::createOrLookupContainer, create(2), *sandboxed);
    const std::string path = *data.get("ReplyPath")->asString();
    const std::string devicePath = Paths(root_.path()).devicePath(path);
    ASSERT_NE(devicePath, path);
    EXPECT_EQ(*data.get("ReplySandboxToken"),
              Value("token:com.orvex.sandbox.container:" + devicePath));
    EXPECT_EQ(*data.get("ReplyPersonaUniqueString"), Value("P-ENT"));
    ASSERT_EQ(extensions_->issued.size(), 1u);
    EXPECT_EQ(extensions_->issued[0].token[0], 0xAB);

    // A class without an extension class, and the same persona unsandboxed.
    EXPECT_EQ(run(&QRNCommandHandlers::createOrLookupContainer, create(9), *sandboxed)
                  .get("ReplySandboxToken"),
              nullptr);
    EXPECT_TRUE(log.contains("is sandboxed and container (type: 9) is enterprise: 1. NOT issuing"));
    EXPECT_EQ(
        run(&QRNCommandHandlers::createOrLookupContainer, create(2), *client(enterprise(), false))
            .get("ReplySandboxToken"),
        nullptr);
    EXPECT_EQ(run(&QRNCommandHandlers::createOrLookupContainer, create(2), *client(user(), true))
                  .get("ReplySandboxToken"),
              nullptr);
    EXPECT_EQ(extensions_->issued.size(), 1u);

    extensions_->failing = true;
    EXPECT_EQ(run(&QRNCommandHandlers::createOrLookupContainer, create(2), *sandboxed)
                  .get("ReplySandboxToken"),
              nullptr);
    EXPECT_TRUE(
        log.contains("issuing a sandbox extension failed for com.example.vellclient at path " +
                     devicePath + ": 1"))
        << log.all();
}

TEST_F(SandboxTokenTest, GroupRepliesCarryTokenAndPersonaDictionariesOnlyWhenNotEmpty) {
    mapping_->appGroups[kVellClient] = arrayOf({Value("group.a")});
    Value request = dictionaryOf({{"Identifier", Value(kVellClient)}});
    Value enterpriseReply =
        run(&QRNCommandHandlers::groupContainersForOwner, request, *client(enterprise(), true));
    const Value* token = enterpriseReply.get("ReplySandboxTokenDict");
    ASSERT_TRUE(token) << enterpriseReply.description();
    EXPECT_EQ(
        token->get("group.a")->asString()->rfind("token:com.orvex.sandbox.application-group:", 0),
        0u);
    EXPECT_EQ(*enterpriseReply.get("ReplyPersonaUniqueStringDict"),
              dictionaryOf({{"group.a", Value("P-ENT")}}));

    Value personal =
        run(&QRNCommandHandlers::groupContainersForOwner, request, *client(user(), true));
    EXPECT_EQ(personal.get("ReplyGroupContainerDict")->size(), 1u);
    EXPECT_EQ(personal.get("ReplySandboxTokenDict"), nullptr);
    EXPECT_EQ(personal.get("ReplyPersonaUniqueStringDict"), nullptr);
}

TEST_F(SandboxTokenTest, ClientsWithoutAPersonaKeepTheirOwnWhenNoneHoldsTheBundle) {
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
    EXPECT_EQ(unspecific->userIdentityForGroupOwner("com.example.x").error(), 76u);
    run(&QRNCommandHandlers::groupContainersForOwner,
        dictionaryOf({{"Identifier", Value("com.example.x")}}), *unspecific, 76);
    // Classes that are not data classes never choose.
    log.clear();
    EXPECT_EQ(*unspecific->userIdentityForContainerIdentifier("com.example.x", 1),
              unspecific->userIdentity());
    EXPECT_FALSE(log.contains("trying to look up persona"));
}

} // namespace
