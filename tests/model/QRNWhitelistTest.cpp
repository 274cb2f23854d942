#include "Daemon/model/QRNWhitelist.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

namespace {

// Classes that have exceptions anywhere in the tables, plus neighbours.
constexpr std::uint64_t kClasses[] = {0, 1, 2, 7, 10, 12, 13};

bool may(std::string_view client, std::uint64_t cls, std::string_view container) {
    return QRNWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(client, cls,
                                                                                     container);
}

} // namespace

TEST(QRNWhitelist, WellknownContainersAreNamedByIdentifierInTheirOwnClassOnly) {
    QRNWhitelist whitelist;
    EXPECT_EQ(whitelist.wellknownSystemContainers(),
              (std::vector<std::string>{"com.orvex.accountsd", "com.orvex.devicesettings"}));
    auto groups = whitelist.wellknownSystemGroupContainers();
    ASSERT_EQ(groups.size(), 8u);
    for (const auto& group : groups) {
        EXPECT_TRUE(whitelist.containerIdIsWellknown(group, 13)) << group;
        EXPECT_EQ(whitelist.wellknownContainerForId(group, 13), group);
        EXPECT_FALSE(whitelist.systemContainerIdIsWellknown(group)) << group;
        EXPECT_FALSE(whitelist.containerIdIsWellknown(group, 12)) << group;
    }
    EXPECT_EQ(whitelist.wellknownSystemContainerForId("com.orvex.devicesettings"),
              "com.orvex.devicesettings");
    EXPECT_EQ(whitelist.wellknownContainerForId("com.orvex.accountsd", 12), "com.orvex.accountsd");
    EXPECT_TRUE(whitelist.systemGroupContainerIdIsWellknown("systemgroup.com.orvex.pairing"));
    // Same identifiers in other classes, near misses and empty names are not well known.
    EXPECT_FALSE(whitelist.containerIdIsWellknown("com.orvex.accountsd", 13));
    EXPECT_FALSE(whitelist.containerIdIsWellknown("com.orvex.accountsd", 2));
    EXPECT_FALSE(whitelist.containerIdIsWellknown("systemgroup.com.orvex.pairing", 7));
    EXPECT_FALSE(whitelist.systemContainerIdIsWellknown("com.orvex.accountsd2"));
    EXPECT_FALSE(whitelist.systemGroupContainerIdIsWellknown(""));
    EXPECT_EQ(whitelist.wellknownSystemGroupContainerForId("com.orvex.devicesettings"),
              std::nullopt);
}

TEST(QRNWhitelist, SharedInstanceBelongsToTheContext) {
    test::TempRoot root;
    EXPECT_EQ(&QRNWhitelist::sharedWhitelist(), &root.context().instance<QRNWhitelist>());
}

TEST(QRNWhitelist, NullMarkerGrantsWholeClassesOrEverything) {
    test::TempRoot root;
    for (auto cls : kClasses) {
        EXPECT_TRUE(may("com.orvex.backupd", cls, "any.thing")) << cls;
    }
    EXPECT_FALSE(may("com.orvex.backupd", 14, "any.thing"));
    EXPECT_FALSE(may("com.orvex.backupd", 99, "any.thing"));

    EXPECT_TRUE(may("com.orvex.settings", 2, "any.thing"));
    EXPECT_TRUE(may("com.orvex.settings", 7, "any.thing"));
    EXPECT_FALSE(may("com.orvex.settings", 12, "any.thing"));
    EXPECT_TRUE(may("com.orvex.diagnosticsd", 12, "x"));
    EXPECT_TRUE(may("com.orvex.diagnosticsd", 13, "x"));
    EXPECT_FALSE(may("com.orvex.diagnosticsd", 2, "x"));
    EXPECT_TRUE(may("com.orvex.mediasyncd", 2, "x"));
    EXPECT_FALSE(may("com.orvex.mediasyncd", 4, "x"));
    EXPECT_TRUE(may("com.orvex.homescreen", 10, "x"));
    EXPECT_FALSE(may("com.orvex.homescreen", 9, "x"));
}

TEST(QRNWhitelist, IdentifierSetsGrantTheirMembersOnly) {
    test::TempRoot root;
    EXPECT_TRUE(may("com.orvex.searchd", 2, "com.orvex.notes"));
    EXPECT_TRUE(may("com.orvex.searchd", 2, "com.orvex.mail"));
    EXPECT_FALSE(may("com.orvex.searchd", 2, "com.orvex.photos"));
    EXPECT_FALSE(may("com.orvex.searchd", 4, "com.orvex.notes"));
    EXPECT_TRUE(may("com.orvex.accountsd", 12, "com.orvex.accountsd"));
    EXPECT_FALSE(may("com.orvex.accountsd", 12, "com.orvex.devicesettings"));
    EXPECT_TRUE(may("com.orvex.filesd", 7, "group.any"));
    EXPECT_TRUE(may("com.orvex.filesd", 13, "systemgroup.com.orvex.mediaindex"));
    EXPECT_FALSE(may("com.orvex.filesd", 13, "systemgroup.com.orvex.pairing"));
    EXPECT_TRUE(may("com.orvex.pairingd", 13, "systemgroup.com.orvex.pairing"));
    EXPECT_FALSE(may("com.orvex.pairingd", 12, "systemgroup.com.orvex.pairing"));
}

TEST(QRNWhitelist, OpenSetsApplyToEveryClientBeforeTheirEntries) {
    test::TempRoot root;
    for (std::string_view client : {"", "com.unknown.app", "com.orvex.pairingd"}) {
        EXPECT_TRUE(may(client, 13, "systemgroup.com.orvex.diagnostics")) << client;
        EXPECT_FALSE(may(client, 12, "systemgroup.com.orvex.diagnostics")) << client;
        EXPECT_FALSE(may(client, 13, "systemgroup.com.orvex.telemetry")) << client;
    }
    EXPECT_FALSE(may("com.unknown.app", 2, "com.orvex.notes"));
}
