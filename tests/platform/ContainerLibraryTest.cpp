#include "Daemon/platform/ContainerLibrary.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(ContainerLibrary, SubdirectoriesPerClassParentsFirst) {
    LinuxContainerLibrary lib;
    EXPECT_TRUE(lib.subdirectoryNamesForClass(1)->empty());
    // Parents come before their children so each can be made in turn.
    EXPECT_EQ(*lib.subdirectoryNamesForClass(2),
              (std::vector<std::string>{"Documents", "Library", "Library/Caches",
                                        "Library/Preferences", "SystemData", "tmp"}));
    for (std::uint64_t cls : {0, 14, 99}) {
        auto r = lib.subdirectoryNamesForClass(cls);
        ASSERT_FALSE(r) << cls;
        EXPECT_EQ(r.error(), kQRNErrorUnexpectedContainerType);
    }
}
