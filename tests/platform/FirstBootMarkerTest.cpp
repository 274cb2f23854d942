#include "Daemon/platform/FirstBootMarker.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <regex>

using namespace quarn;

TEST(FirstBootMarkerTest, MarkersOfTwoRootsAreIndependent) {
    quarn::test::TempRoot rootA;
    quarn::test::TempRoot rootB(quarn::test::TempRoot::Options{true, false});
    const FirstBootMarker a(rootA.path());
    const FirstBootMarker b(rootB.path());
    ASSERT_NE(a.name(), b.name());
    EXPECT_TRUE(std::regex_match(a.name(), std::regex("/quarnd\\.fb_check\\.[0-9a-f]{8}")));
    // The same root, spelt with a trailing slash, is the same marker.
    EXPECT_EQ(FirstBootMarker(rootA.path().string() + "/").name(), a.name());
    EXPECT_EQ(FirstBootMarker("/").name(), "/quarnd.fb_check");

    ASSERT_TRUE(a.remove());
    ASSERT_TRUE(b.remove());
    EXPECT_FALSE(a.exists());

    ASSERT_TRUE(a.create());
    EXPECT_TRUE(a.exists());
    EXPECT_FALSE(b.exists());
    ASSERT_TRUE(a.create()) << "creating an existing marker is no error";

    ASSERT_TRUE(b.create());
    ASSERT_TRUE(a.remove());
    EXPECT_FALSE(a.exists());
    EXPECT_TRUE(b.exists());
    ASSERT_TRUE(a.remove()) << "removing an absent marker is no error";
    ASSERT_TRUE(b.remove());
    EXPECT_FALSE(b.exists());
}
