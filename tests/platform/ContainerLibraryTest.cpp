#include "Daemon/platform/ContainerLibrary.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(ContainerLibrary, SubdirectoriesPerClass) {
    LinuxContainerLibrary lib;
    for (std::uint64_t cls : {1, 3, 5, 8}) {
        ASSERT_TRUE(lib.subdirectoryNamesForClass(cls)) << cls;
        EXPECT_TRUE(lib.subdirectoryNamesForClass(cls)->empty()) << cls;
    }
    auto data = lib.subdirectoryNamesForClass(2);
    ASSERT_TRUE(data);
    // Parents come before their children so each can be made in turn.
    EXPECT_EQ(*data, (std::vector<std::string>{"Documents", "Library", "Library/Caches",
                                               "Library/Preferences", "SystemData", "tmp"}));
    EXPECT_EQ(*lib.subdirectoryNamesForClass(11), std::vector<std::string>{"tmp"});
    EXPECT_EQ(lib.subdirectoryNamesForClass(10)->size(), 4u);
    EXPECT_EQ(lib.subdirectoryNamesForClass(13)->size(), 3u);
    for (std::uint64_t cls : {0, 14, 99}) {
        auto r = lib.subdirectoryNamesForClass(cls);
        ASSERT_FALSE(r);
        EXPECT_EQ(r.error(), kQRNErrorUnexpectedContainerType);
    }
}
