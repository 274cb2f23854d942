#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentity.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>

using namespace quarn;

// Each predicate over 0..15 (and a few large numbers) against the class sets
// the rest of the daemon relies on.
TEST(QRNContainerClass, PredicatesAndTransientBasesMatchTheClassSets) {
    using Set = std::set<std::uint64_t>;
    using TB = QRNContainerClass::TransientBase;
    const Set bundle{1, 3, 5, 8}, system{12, 13}, group{7, 13}, perUser{2, 4, 6, 7, 9, 10, 11},
        transient{2, 4, 6, 7, 12, 13};
    for (std::uint64_t c = 0; c <= 15; ++c) {
        SCOPED_TRACE(c);
        const bool isBundle = bundle.count(c), isSystem = system.count(c);
        EXPECT_EQ(QRNContainerClass::isValid(c), c >= 1 && c <= 13);
        EXPECT_EQ(QRNContainerClass::isBundle(c), isBundle);
        EXPECT_EQ(QRNContainerClass::isSystem(c), isSystem);
        EXPECT_EQ(QRNContainerClass::isGlobal(c), isBundle || isSystem);
        EXPECT_EQ(QRNContainerClass::isGroup(c), group.count(c) != 0);
        EXPECT_EQ(QRNContainerClass::usesPerUserStaging(c), perUser.count(c) != 0);
        EXPECT_EQ(QRNContainerClass::isPerUser(c), perUser.count(c) != 0);
        // Required for everything that is not bundle or system, invalid
        // numbers included: those are refused later by the range check.
        EXPECT_EQ(QRNContainerClass::isUserIdentityRequired(c), !isBundle && !isSystem);
        EXPECT_EQ(QRNUserIdentity::isUserIdentityRequiredForContainerClass(c),
                  !isBundle && !isSystem);
        EXPECT_EQ(QRNContainerClass::baseDirectoryOwner(c), isBundle ? 33u : 0u);
        EXPECT_EQ(QRNContainerClass::transientBase(c), isBundle             ? TB::TransientBundle
                                                       : transient.count(c) ? TB::Transient
                                                                            : TB::None);
    }
    for (std::uint64_t c : {std::uint64_t{64}, std::uint64_t{0x12a}, ~std::uint64_t{0}}) {
        SCOPED_TRACE(c);
        EXPECT_FALSE(QRNContainerClass::isValid(c) || QRNContainerClass::isBundle(c) ||
                     QRNContainerClass::isSystem(c) || QRNContainerClass::usesPerUserStaging(c));
        EXPECT_TRUE(QRNContainerClass::isUserIdentityRequired(c));
    }
}

// Every valid class has its own two-component directory (the layout appends
// it to a base) whose first part says what kind of class it is; nothing past
// the end marker has one.
TEST(QRNContainerClass, EachClassHasItsOwnDirectoryAndName) {
    EXPECT_EQ(QRNContainerClass::relativeDirectory(15), "");
    EXPECT_EQ(QRNContainerClass::shortName(14), "");
    std::set<std::string> seenDirs, seenNames;
    for (std::uint64_t c = 1; c <= 13; ++c) {
        SCOPED_TRACE(c);
        std::filesystem::path dir(QRNContainerClass::relativeDirectory(c));
        EXPECT_EQ(std::distance(dir.begin(), dir.end()), 2);
        EXPECT_TRUE(seenDirs.insert(dir.string()).second);
        EXPECT_TRUE(seenNames.insert(std::string(QRNContainerClass::shortName(c))).second);
        EXPECT_EQ(dir.begin()->string(), QRNContainerClass::isBundle(c)  ? "Bundle"
                                         : QRNContainerClass::isGroup(c) ? "Shared"
                                                                         : "Data");
    }
}
