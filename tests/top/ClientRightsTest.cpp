// The rights a client brings: its entitlements as booleans, the lookup
// entitlement per class, the privileged identities of the daemon's own
// work, and the protection class its entitlements ask for.

#include "Daemon/QRNClientConnection.h"
#include "Daemon/QRNClientIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/protection/QRNDataProtectionManager.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;
using namespace quarn::test;

namespace {

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

class ClientRightsTest : public TempRootTest {
protected:
    QRNClientIdentityPtr client(Value entitlements) {
        return QRNClientIdentity::initWithBundleIdentifier(
            "com.example.client", kMobileUID, kMobileUID, 77,
            QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity(),
            std::move(entitlements), true, QRNClientIdentity::AuditToken{}, false);
    }
    std::shared_ptr<QRNClientConnection> withLookup(std::optional<Value> lookup) {
        return std::make_shared<QRNClientConnection>(client(Value::dictionary()), false, false,
                                                     false, std::move(lookup), std::nullopt,
                                                     nullptr);
    }
};

TEST_F(ClientRightsTest, OnlyBooleansAndNumbersGrantAnEntitlement) {
    auto identity = client(dictionaryOf({
        {"flag", Value(true)},
        {"off", Value(false)},
        {"one", Value(1)},
        {"zero", Value(0)},
        {"text", Value("true")},
        {"dict", dictionaryOf({{"x", Value(true)}})},
        {"list", arrayOf({Value(true)})},
    }));
    ASSERT_TRUE(identity);
    EXPECT_TRUE(identity->boolValueOfEntitlement("flag"));
    EXPECT_TRUE(identity->boolValueOfEntitlement("one"));
    for (const char* refused : {"off", "zero", "text", "dict", "list", "absent"}) {
        EXPECT_FALSE(identity->boolValueOfEntitlement(refused)) << refused;
    }
}

TEST_F(ClientRightsTest, MalformedEntitlementsBecomeAnEmptyDictionary) {
    auto identity = client(Value("not a dictionary"));
    ASSERT_TRUE(identity);
    EXPECT_TRUE(identity->entitlements().isDictionary());
    EXPECT_EQ(identity->entitlements().size(), 0u);
    EXPECT_EQ(QRNClientIdentity::initWithBundleIdentifier("x", 501, 501, 1, nullptr,
                                                          Value::dictionary(), false,
                                                          QRNClientIdentity::AuditToken{}, false),
              nullptr);
}

TEST_F(ClientRightsTest, PrivilegedIdentitiesCarryNoIdsNoEntitlementsAndNoSandbox) {
    auto user = QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity();
    for (bool kernel : {false, true}) {
        auto identity = QRNClientIdentity::privilegedClientIdentityWithUserIdentity(user, kernel);
        ASSERT_TRUE(identity);
        EXPECT_EQ(identity->bundleIdentifier(), "com.orvex.quarnd.internal");
        EXPECT_EQ(identity->posixUID(), 0u);
        EXPECT_EQ(identity->posixPID(), 0);
        EXPECT_EQ(identity->isKernel(), kernel);
        EXPECT_FALSE(identity->isSandboxed());
        EXPECT_EQ(identity->entitlements().size(), 0u);
        EXPECT_EQ(identity->auditToken(), QRNClientIdentity::AuditToken{});
    }
    auto anonymous = QRNClientIdentity::anonymousPrivilegedClientIdentity();
    ASSERT_TRUE(anonymous);
    EXPECT_FALSE(anonymous->isKernel());
    EXPECT_TRUE(anonymous->userIdentity()->isEqual(*user));
    // Class owners come from the user identity.
    EXPECT_EQ(anonymous->posixUIDForContainerClass(kQRNContainerClassAppData), kMobileUID);
    EXPECT_EQ(anonymous->posixUIDForContainerClass(kQRNContainerClassAppBundle), 33u);
}

TEST_F(ClientRightsTest, PlainInitIsRefused) {
    LogCapture log;
    EXPECT_EQ(QRNClientIdentity::init(), nullptr);
    EXPECT_TRUE(log.contains("You cannot init this class directly.")) << log.all();
}

TEST_F(ClientRightsTest, LookupEntitlementIsReadPerClassByShortName) {
    auto connection = withLookup(dictionaryOf({
        {"appData", arrayOf({Value("com.a"), Value(7), Value("com.b"), dictionaryOf({})})},
        {"appGroup", Value("group.a")},
        {"systemGroup", arrayOf({})},
    }));
    auto appData = connection->_lookupForContainerClass(kQRNContainerClassAppData);
    ASSERT_TRUE(appData);
    EXPECT_EQ(*appData, (QRNClientConnection::IdentifierSet{"com.a", "com.b"}));
    // Made once per class and kept.
    EXPECT_EQ(connection->_lookupForContainerClass(kQRNContainerClassAppData), appData);

    EXPECT_TRUE(connection->isEntitledForLookupWithClass(kQRNContainerClassAppData, "com.b"));
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(kQRNContainerClassAppData, "com.c"));
    // The same identifier under another class's name grants nothing here.
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(kQRNContainerClassPluginData, "com.a"));
    // Not an array, or absent: an empty set rather than none.
    for (std::uint64_t cls :
         {kQRNContainerClassAppGroup, kQRNContainerClassSystemGroup, kQRNContainerClassVPNData}) {
        auto set = connection->_lookupForContainerClass(cls);
        ASSERT_TRUE(set) << cls;
        EXPECT_TRUE(set->empty()) << cls;
    }
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(kQRNContainerClassAppGroup, "group.a"));
    // Outside the class table there is nothing to ask.
    EXPECT_EQ(connection->_lookupForContainerClass(0), nullptr);
    EXPECT_EQ(connection->_lookupForContainerClass(14), nullptr);
}

TEST_F(ClientRightsTest, WithoutLookupEntitlementNothingIsGranted) {
    auto connection = withLookup(std::nullopt);
    EXPECT_EQ(connection->_lookupForContainerClass(kQRNContainerClassAppData), nullptr);
    EXPECT_FALSE(connection->isEntitledForLookupWithClass(kQRNContainerClassAppData, ""));
}

TEST_F(ClientRightsTest, SetOfStringsKeepsOnlyStrings) {
    EXPECT_EQ(QRNClientConnection::_setOfStringsFromArray(
                  arrayOf({Value("a"), Value("a"), Value(true), Value("b")})),
              (QRNClientConnection::IdentifierSet{"a", "b"}));
    EXPECT_TRUE(QRNClientConnection::_setOfStringsFromArray(Value("a")).empty());
}

TEST_F(ClientRightsTest, EntitledProtectionClassFollowsTheFirstKeyPresent) {
    using M = QRNDataProtectionManager;
    const std::pair<std::string_view, int> levels[] = {
        {M::kProtectionComplete, 1},
        {M::kProtectionCompleteUnlessOpen, 2},
        {M::kProtectionCompleteUntilFirstUserAuthentication, 3},
        {M::kProtectionNone, 4},
        {M::kProtectionWriteOnly, 2},
        {M::kProtectionCompleteUntilUserAuthentication, 3},
    };
    for (const auto& [level, expected] : levels) {
        for (const char* key : {"com.orvex.developer.default-data-protection",
                                "data-protection-class", "DataProtectionClass"}) {
            EXPECT_EQ(
                M::intendedDataProtectionClassForEntitlements(dictionaryOf({{key, Value(level)}})),
                expected)
                << key << " " << level;
        }
    }
    // The first key present decides, even when it holds no string.
    EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(
                  dictionaryOf({{"data-protection-class", Value(M::kProtectionNone)},
                                {"DataProtectionClass", Value(M::kProtectionComplete)}})),
              4);
    EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(
                  dictionaryOf({{"com.orvex.developer.default-data-protection", Value(1)},
                                {"DataProtectionClass", Value(M::kProtectionComplete)}})),
              0);
    EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(Value::dictionary()), 0);

    LogCapture log;
    EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(
                  dictionaryOf({{"DataProtectionClass", Value("Sometimes")}})),
              0);
    EXPECT_TRUE(log.contains(
        "Unknown value for DataProtectionClass entitlement: Sometimes; defaulting to class 0"))
        << log.all();
}

TEST_F(ClientRightsTest, EntitledProtectionClassAsksTheEntitlementsSource) {
    auto& manager = QRNDataProtectionManager::defaultManager();
    EXPECT_EQ(manager.intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.a"), 0);
    std::vector<std::string> asked;
    manager.setEntitlementsSource([&asked](std::string_view identifier) -> std::optional<Value> {
        asked.emplace_back(identifier);
        if (identifier != "com.a") {
            return std::nullopt;
        }
        return dictionaryOf(
            {{"DataProtectionClass", Value(QRNDataProtectionManager::kProtectionNone)}});
    });
    EXPECT_EQ(manager.intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.a"), 4);
    EXPECT_EQ(manager.intendedDataProtectionClassBasedOnEntitlementsForIdentifier("com.b"), 0);
    EXPECT_EQ(asked, (std::vector<std::string>{"com.a", "com.b"}));
}

} // namespace
