// The rights a client brings: its entitlements as booleans, the lookup
// entitlement per class, the privileged identities of the daemon's own
// work, and the protection class its entitlements ask for.

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/protection/QRNDataProtectionManager.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

using namespace quarn;
using namespace quarn::test;

namespace {

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
}

TEST_F(ClientRightsTest, SharedConnectionIsPrivilegedAndOneInstance) {
    auto& shared = QRNClientConnection::sharedClientConnection();
    EXPECT_EQ(&shared, &QRNClientConnection::sharedClientConnection());
    EXPECT_TRUE(shared.unrestricted());
    EXPECT_TRUE(shared.allowOtherIdLookup());
    ASSERT_TRUE(shared.clientIdentity());
    EXPECT_FALSE(shared.clientIdentity()->isKernel());
    EXPECT_EQ(shared.clientBundleIdentifier(), "com.orvex.quarnd.internal");
    EXPECT_TRUE(shared.commandQueue());
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
    // Outside the class table, or without the entitlement, there is nothing to ask.
    EXPECT_EQ(connection->_lookupForContainerClass(0), nullptr);
    EXPECT_EQ(connection->_lookupForContainerClass(14), nullptr);
    EXPECT_EQ(withLookup(std::nullopt)->_lookupForContainerClass(kQRNContainerClassAppData),
              nullptr);
}

TEST_F(ClientRightsTest, EntitledProtectionClassFollowsTheFirstKeyPresent) {
    using M = QRNDataProtectionManager;
    EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(
                  dictionaryOf({{"DataProtectionClass", Value(M::kProtectionWriteOnly)}})),
              2);
    EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(
                  dictionaryOf({{"data-protection-class", Value(M::kProtectionNone)},
                                {"DataProtectionClass", Value(M::kProtectionComplete)}})),
              4);
    // The first key present decides, even when it holds no string.
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

} // namespace
