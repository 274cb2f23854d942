#include "Daemon/platform/LinuxHostConfig.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(HostFlagsParsing, AcceptsOnlyOneUnsigned32BitDecimal) {
    EXPECT_EQ(LinuxHostConfig::parseFlags("0"), 0u);
    EXPECT_EQ(LinuxHostConfig::parseFlags(" \t5\n"), 5u);
    EXPECT_EQ(LinuxHostConfig::parseFlags("0010"), 10u);
    EXPECT_EQ(LinuxHostConfig::parseFlags("4294967295"), 4294967295u);
    for (const char* bad : {"", "  \n", "4294967296", "-1", "+1", "0x10", "1 2", "12abc", "1.0"}) {
        EXPECT_FALSE(LinuxHostConfig::parseFlags(bad)) << '"' << bad << '"';
    }
}

TEST(HostFlags, ReadFromTheRootsConfigDirectory) {
    quarn::test::TempRoot root;
    auto& config = root.context().instance<HostConfig>();
    EXPECT_FALSE(config.multiUserFlags());

    root.writeFile("/etc/quarnd/host-multiuser-flags", "3\n");
    EXPECT_EQ(config.multiUserFlags(), 3u);

    root.writeFile("/etc/quarnd/host-multiuser-flags", "three\n");
    EXPECT_FALSE(config.multiUserFlags());

    root.writeFile("/etc/quarnd/host-multiuser-flags", std::string(1000, '1'));
    EXPECT_FALSE(config.multiUserFlags());

    std::filesystem::remove(root / "/etc/quarnd/host-multiuser-flags");
    std::filesystem::create_directory(root / "/etc/quarnd/host-multiuser-flags");
    EXPECT_FALSE(config.multiUserFlags());
}
