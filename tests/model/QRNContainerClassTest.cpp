#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentity.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <set>
#include <string>

using namespace quarn;

namespace {

using Set = std::set<std::uint64_t>;

bool in(const Set& s, std::uint64_t c) {
    return s.count(c) != 0;
}

} // namespace

// Each predicate over 0..15 (and a few large numbers) against the class sets
// the rest of the daemon relies on.
TEST(QRNContainerClass, PredicatesMatchTheClassSets) {
    const Set bundle{1, 3, 5, 8}, system{12, 13}, group{7, 13}, perUser{2, 4, 6, 7, 9, 10, 11};
    for (std::uint64_t c = 0; c <= 15; ++c) {
        SCOPED_TRACE(c);
        EXPECT_EQ(QRNContainerClass::isValid(c), c >= 1 && c <= 13);
        EXPECT_EQ(QRNContainerClass::isBundle(c), in(bundle, c));
        EXPECT_EQ(QRNContainerClass::isSystem(c), in(system, c));
        EXPECT_EQ(QRNContainerClass::isGlobal(c), in(bundle, c) || in(system, c));
        EXPECT_EQ(QRNContainerClass::isGroup(c), in(group, c));
        EXPECT_EQ(QRNContainerClass::usesPerUserStaging(c), in(perUser, c));
        EXPECT_EQ(QRNContainerClass::isPerUser(c), in(perUser, c));
        // Required for everything that is not bundle or system, invalid
        // numbers included: those are refused later by the range check.
        EXPECT_EQ(QRNContainerClass::isUserIdentityRequired(c), !in(bundle, c) && !in(system, c));
        EXPECT_EQ(QRNUserIdentity::isUserIdentityRequiredForContainerClass(c),
                  QRNContainerClass::isUserIdentityRequired(c));
        EXPECT_EQ(QRNContainerClass::baseDirectoryOwner(c), in(bundle, c) ? 33u : 0u);
    }
    for (std::uint64_t c : {std::uint64_t{64}, std::uint64_t{0x12a}, ~std::uint64_t{0}}) {
        SCOPED_TRACE(c);
        EXPECT_FALSE(QRNContainerClass::isValid(c));
        EXPECT_FALSE(QRNContainerClass::isBundle(c));
        EXPECT_FALSE(QRNContainerClass::isSystem(c));
        EXPECT_FALSE(QRNContainerClass::usesPerUserStaging(c));
        EXPECT_TRUE(QRNContainerClass::isUserIdentityRequired(c));
    }
}

TEST(QRNContainerClass, TransientBaseOfEachClass) {
    using TB = QRNContainerClass::TransientBase;
    for (std::uint64_t c = 0; c <= 15; ++c) {
        SCOPED_TRACE(c);
        TB expected = TB::None;
        if (in({1, 3, 5, 8}, c)) {
            expected = TB::TransientBundle;
        } else if (in({2, 4, 6, 7, 12, 13}, c)) {
            expected = TB::Transient;
        }
        EXPECT_EQ(QRNContainerClass::transientBase(c), expected);
    }
}

TEST(QRNContainerClass, DirectoryAndNameTables) {
    EXPECT_EQ(QRNContainerClass::relativeDirectory(2), "Data/Application");
    EXPECT_EQ(QRNContainerClass::relativeDirectory(0), "Undefined");
    EXPECT_EQ(QRNContainerClass::relativeDirectory(14), "MAX");
    EXPECT_EQ(QRNContainerClass::relativeDirectory(15), "");
    EXPECT_EQ(QRNContainerClass::shortName(10), "daemon");
    EXPECT_EQ(QRNContainerClass::shortName(14), "");

    // Every valid class has its own two-component directory (the layout
    // appends it to a base) whose first part says what kind of class it is.
    std::set<std::string> seenDirs, seenNames;
    for (std::uint64_t c = 1; c <= 13; ++c) {
        SCOPED_TRACE(c);
        std::filesystem::path dir(QRNContainerClass::relativeDirectory(c));
        EXPECT_EQ(std::distance(dir.begin(), dir.end()), 2);
        EXPECT_TRUE(seenDirs.insert(dir.string()).second);
        EXPECT_TRUE(seenNames.insert(std::string(QRNContainerClass::shortName(c))).second);
        const std::string top = dir.begin()->string();
        if (QRNContainerClass::isBundle(c)) {
            EXPECT_EQ(top, "Bundle");
        } else if (QRNContainerClass::isGroup(c)) {
            EXPECT_EQ(top, "Shared");
        } else {
            EXPECT_EQ(top, "Data");
        }
    }
}
