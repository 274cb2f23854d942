// Who may look up or create which container: each right on its own, the
// lookup entitlement, the well-known exceptions, and the system-container
// check. A refused request must not touch the disk.

#include "CreateFixture.h"

#include "Daemon/model/QRNContainerClass.h"

#include "common/LogCapture.h"

using namespace quarn;
using namespace quarn::test;

namespace {

class CreateOrLookupAccessTest : public CreateFixture {
protected:
    // The code of a lookup that does not create: 21 means the access checks passed.
    std::uint64_t lookupCode(QRNClientConnection& connection, const std::string& identifier,
                             std::uint64_t cls) {
        auto found = connection.createOrLookupContainerWithContainerIdentity(
            identity(identifier, cls), false, false, true);
        return found ? kQRNErrorNone : found.error();
    }
    static Value lookupEntitlement(const char* shortName, Value granted) {
        Value lookup = Value::dictionary();
        lookup.set(shortName, std::move(granted));
        return lookup;
    }
    static Value array(std::initializer_list<const char*> items) {
        Value::Array values;
        for (const char* item : items) {
            values.emplace_back(item);
        }
        return Value(std::move(values));
    }
};

TEST_F(CreateOrLookupAccessTest, AnotherIdentifierWithoutRightsIsRefusedBeforeAnyDiskAccess) {
    auto connection = connectionFor(kClientBundle);
    const std::uint64_t before = totalCalls();
    LogCapture log;
    auto made = connection->createOrLookupContainerWithContainerIdentity(
        identity("com.other.app", kQRNContainerClassAppData), true, false, true);
    ASSERT_FALSE(made.has_value());
    EXPECT_EQ(made.error(), kQRNErrorNotEntitled);
    EXPECT_EQ(totalCalls(), before);
    EXPECT_TRUE(log.contains(
        "com.example.client not entitled to retrieve container class 2 with identifier "
        "com.other.app"))
        << log.all();
}

TEST_F(CreateOrLookupAccessTest, EachRightAdmitsOnItsOwn) {
    const std::string other = "com.other.app";
    EXPECT_EQ(lookupCode(*connectionFor(kClientBundle, Rights::otherIds()), other,
                         kQRNContainerClassAppData),
              kQRNErrorContainerNotFound);
    EXPECT_EQ(lookupCode(*connectionFor(kClientBundle, Rights::everything()), other,
                         kQRNContainerClassAppData),
              kQRNErrorContainerNotFound);

    auto groups = connectionFor(kClientBundle);
    groups->setAllowGroupIdLookup(true);
    EXPECT_EQ(lookupCode(*groups, "group.other", kQRNContainerClassAppGroup),
              kQRNErrorContainerNotFound);
    EXPECT_EQ(lookupCode(*groups, "systemgroup.other", kQRNContainerClassSystemGroup),
              kQRNErrorContainerNotFound);
    // The group right is for group classes only.
    EXPECT_EQ(lookupCode(*groups, other, kQRNContainerClassAppData), kQRNErrorNotEntitled);

    auto widened = connectionFor(kClientBundle);
    EXPECT_EQ(lookupCode(*widened, other, kQRNContainerClassAppData), kQRNErrorNotEntitled);
    widened->setAllowOtherIdLookup(true);
    EXPECT_EQ(lookupCode(*widened, other, kQRNContainerClassAppData), kQRNErrorContainerNotFound);
}

TEST_F(CreateOrLookupAccessTest, LookupEntitlementGrantsListedIdentifiersOfItsClassOnly) {
    auto listed = connectionFor(
        kClientBundle, Rights::lookingUp(lookupEntitlement("appData", array({"com.other.app"}))));
    EXPECT_EQ(lookupCode(*listed, "com.other.app", kQRNContainerClassAppData),
              kQRNErrorContainerNotFound);
    EXPECT_EQ(lookupCode(*listed, "com.third.app", kQRNContainerClassAppData),
              kQRNErrorNotEntitled);
    EXPECT_EQ(lookupCode(*listed, "com.other.app", kQRNContainerClassPluginData),
              kQRNErrorNotEntitled);

    // A string where an array belongs grants nothing.
    auto malformed = connectionFor(
        kClientBundle, Rights::lookingUp(lookupEntitlement("appData", Value("com.other.app"))));
    EXPECT_EQ(lookupCode(*malformed, "com.other.app", kQRNContainerClassAppData),
              kQRNErrorNotEntitled);
}

TEST_F(CreateOrLookupAccessTest, WellKnownLookupExceptionsAdmitTheirClients) {
    auto search = connectionFor("com.orvex.searchd");
    EXPECT_EQ(lookupCode(*search, "com.orvex.notes", kQRNContainerClassAppData),
              kQRNErrorContainerNotFound);
    EXPECT_EQ(lookupCode(*search, "com.orvex.notes", kQRNContainerClassPluginData),
              kQRNErrorNotEntitled);
    EXPECT_EQ(lookupCode(*search, "com.orvex.photos", kQRNContainerClassAppData),
              kQRNErrorNotEntitled);
    // Open to everyone.
    EXPECT_EQ(lookupCode(*connectionFor(kClientBundle), "systemgroup.com.orvex.diagnostics",
                         kQRNContainerClassSystemGroup),
              kQRNErrorContainerNotFound);
}

TEST_F(CreateOrLookupAccessTest, OwnSystemContainerNeedsADeclaredOne) {
    LogCapture log;
    auto own = connectionFor("com.example.daemon");
    EXPECT_EQ(lookupCode(*own, "com.example.daemon", kQRNContainerClassSystemData),
              kQRNErrorNotEntitled);
    EXPECT_TRUE(log.contains(
        "com.example.daemon not entitled for system container with identifier com.example.daemon"))
        << log.all();
    // Its other classes are its own to use.
    EXPECT_EQ(lookupCode(*own, "com.example.daemon", kQRNContainerClassAppData),
              kQRNErrorContainerNotFound);

    auto entitled = connectionFor(
        "com.example.daemon",
        Rights::lookingUp(lookupEntitlement("systemData", array({"com.example.daemon"}))));
    EXPECT_EQ(lookupCode(*entitled, "com.example.daemon", kQRNContainerClassSystemData),
              kQRNErrorContainerNotFound);
}

TEST_F(CreateOrLookupAccessTest, WellKnownSystemClientGetsItsSystemContainer) {
    auto accounts = connectionFor("com.orvex.accountsd");
    bool existed = true;
    auto made = accounts->createOrLookupContainerWithContainerIdentity(
        identity("com.orvex.accountsd", kQRNContainerClassSystemData), true, false, true, &existed);
    ASSERT_TRUE(made.has_value()) << made.error();
    EXPECT_FALSE(existed);
    EXPECT_EQ((*made)->url().filename(), "com.orvex.accountsd");
    // Another identifier's system container stays closed to it.
    EXPECT_EQ(lookupCode(*accounts, "com.orvex.devicesettings", kQRNContainerClassSystemData),
              kQRNErrorNotEntitled);
}

} // namespace
