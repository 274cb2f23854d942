#include "Daemon/model/QRNWhitelist.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(QRNWhitelist, WellknownContainersAreNamedByIdentifierInTheirOwnClassOnly) {
    test::TempRoot root;
    const QRNWhitelist& whitelist = QRNWhitelist::sharedWhitelist();
    EXPECT_EQ(&whitelist, &root.context().instance<QRNWhitelist>());
    EXPECT_EQ(whitelist.wellknownSystemContainers(),
              (std::vector<std::string>{"com.orvex.accountsd", "com.orvex.devicesettings"}));
    auto groups = whitelist.wellknownSystemGroupContainers();
    ASSERT_EQ(groups.size(), 8u);
    for (const auto& group : groups) {
        EXPECT_EQ(whitelist.wellknownContainerForId(group, 13), group);
        EXPECT_FALSE(whitelist.containerIdIsWellknown(group, 12)) << group;
    }
    EXPECT_EQ(whitelist.wellknownContainerForId("com.orvex.accountsd", 12), "com.orvex.accountsd");
    EXPECT_TRUE(whitelist.systemContainerIdIsWellknown("com.orvex.devicesettings"));
    EXPECT_TRUE(whitelist.systemGroupContainerIdIsWellknown("systemgroup.com.orvex.pairing"));
    // Other classes, near misses and empty names.
    EXPECT_FALSE(whitelist.containerIdIsWellknown("com.orvex.accountsd", 13));
    EXPECT_FALSE(whitelist.containerIdIsWellknown("com.orvex.accountsd", 2));
    EXPECT_FALSE(whitelist.systemContainerIdIsWellknown("com.orvex.accountsd2"));
    EXPECT_FALSE(whitelist.systemGroupContainerIdIsWellknown(""));
    EXPECT_EQ(whitelist.wellknownSystemGroupContainerForId("com.orvex.devicesettings"),
              std::nullopt);
}

TEST(QRNWhitelist, LookupExceptionsFollowNullMarkersSetsAndOpenSets) {
    struct Case {
        const char* client;
        std::uint64_t cls;
        const char* container;
        bool allowed;
    };
    const Case cases[] = {
        // Null marker for the whole client: every class below the end marker.
        {"com.orvex.backupd", 0, "any", true},
        {"com.orvex.backupd", 11, "any", true},
        {"com.orvex.backupd", 13, "any", true},
        {"com.orvex.backupd", 14, "any", false},
        {"com.orvex.backupd", 99, "any", false},
        // Null marker per class: only the listed classes.
        {"com.orvex.settings", 7, "any", true},
        {"com.orvex.settings", 12, "any", false},
        {"com.orvex.diagnosticsd", 12, "any", true},
        {"com.orvex.diagnosticsd", 2, "any", false},
        {"com.orvex.homescreen", 10, "any", true},
        {"com.orvex.homescreen", 9, "any", false},
        // Identifier sets: members only, in their class only.
        {"com.orvex.searchd", 2, "com.orvex.mail", true},
        {"com.orvex.searchd", 2, "com.orvex.photos", false},
        {"com.orvex.searchd", 4, "com.orvex.notes", false},
        {"com.orvex.accountsd", 12, "com.orvex.accountsd", true},
        {"com.orvex.accountsd", 12, "com.orvex.devicesettings", false},
        {"com.orvex.filesd", 7, "any", true},
        {"com.orvex.filesd", 13, "systemgroup.com.orvex.mediaindex", true},
        {"com.orvex.filesd", 13, "systemgroup.com.orvex.pairing", false},
        {"com.orvex.pairingd", 12, "systemgroup.com.orvex.pairing", false},
        // The open set comes first, so it holds for clients with or without entries.
        {"", 13, "systemgroup.com.orvex.diagnostics", true},
        {"com.unknown.app", 13, "systemgroup.com.orvex.diagnostics", true},
        {"com.orvex.pairingd", 13, "systemgroup.com.orvex.diagnostics", true},
        {"com.unknown.app", 12, "systemgroup.com.orvex.diagnostics", false},
        {"com.unknown.app", 13, "systemgroup.com.orvex.telemetry", false},
        {"com.unknown.app", 2, "com.orvex.notes", false},
    };
    QRNWhitelist whitelist;
    for (const auto& c : cases) {
        EXPECT_EQ(whitelist.isLookupWhitelistedFromCodeSignIdentifier(c.client, c.cls, c.container),
                  c.allowed)
            << c.client << " class " << c.cls << " " << c.container;
    }
}
