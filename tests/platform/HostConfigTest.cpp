#include "Daemon/platform/LinuxHostConfig.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(HostFlags, OnlyOneUnsigned32BitDecimalInTheRootsConfigFile) {
    const std::pair<const char*, std::optional<std::uint32_t>> cases[] = {
        {"0", 0},    {" \t5\n", 5}, {"0010", 10},       {"4294967295", 4294967295u},
        {"", {}},    {"  \n", {}},  {"4294967296", {}}, {"-1", {}},
        {"+1", {}},  {"0x10", {}},  {"1 2", {}},        {"12abc", {}},
        {"1.0", {}},
    };
    for (const auto& [text, expected] : cases) {
        EXPECT_EQ(LinuxHostConfig::parseFlags(text), expected) << '"' << text << '"';
    }

    quarn::test::TempRoot root;
    auto& config = root.context().instance<HostConfig>();
    EXPECT_FALSE(config.multiUserFlags());
    root.writeFile("/etc/quarnd/host-multiuser-flags", "3\n");
    EXPECT_EQ(config.multiUserFlags(), 3u);
    for (const std::string& bad : {std::string("three\n"), std::string(1000, '1')}) {
        root.writeFile("/etc/quarnd/host-multiuser-flags", bad);
        EXPECT_FALSE(config.multiUserFlags());
    }
    std::filesystem::remove(root / "/etc/quarnd/host-multiuser-flags");
    std::filesystem::create_directory(root / "/etc/quarnd/host-multiuser-flags");
    EXPECT_FALSE(config.multiUserFlags());
}
