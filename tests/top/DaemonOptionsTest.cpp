// The daemon's command line: what runs, what stops at once, and with which
// status.

#include "Daemon/QRNDaemonOptions.h"

#include <gtest/gtest.h>

#include <filesystem>

using namespace quarn;

namespace {

TEST(DaemonOptionsTest, DefaultsAcceptedValuesAndWhatStopsAtOnce) {
    auto parsed = QRNDaemonOptions::parse({});
    ASSERT_FALSE(parsed.exitStatus) << parsed.output;
    EXPECT_EQ(parsed.options.root, "/");
    EXPECT_FALSE(parsed.options.foreground);
    EXPECT_EQ(parsed.options.logLevel, spdlog::level::info);

    const auto temporary = std::filesystem::temp_directory_path();
    parsed = QRNDaemonOptions::parse(
        {"--root", temporary.string() + "/./", "--foreground", "--log-level", "7"});
    ASSERT_FALSE(parsed.exitStatus) << parsed.output;
    EXPECT_EQ(parsed.options.root, temporary);
    EXPECT_TRUE(parsed.options.foreground);
    EXPECT_EQ(parsed.options.logLevel, spdlog::level::debug);

    for (auto [name, level] : {std::pair{"error", spdlog::level::err},
                               {"3", spdlog::level::err},
                               {"notice", spdlog::level::info},
                               {"debug", spdlog::level::debug}}) {
        parsed = QRNDaemonOptions::parse({"--log-level", name});
        ASSERT_FALSE(parsed.exitStatus) << name << ": " << parsed.output;
        EXPECT_EQ(parsed.options.logLevel, level) << name;
    }

    auto help = QRNDaemonOptions::parse({"--help"});
    EXPECT_EQ(help.exitStatus, 0);
    EXPECT_NE(help.output.find("--root"), std::string::npos) << help.output;

    auto version = QRNDaemonOptions::parse({"--version"});
    EXPECT_EQ(version.exitStatus, 0);
    EXPECT_EQ(version.output.rfind("quarnd ", 0), 0u) << version.output;

    for (const auto& bad :
         std::vector<std::vector<std::string>>{{"--log-level", "verbose"},
                                               {"--log-level", "4"},
                                               {"--root", "/nonexistent/quarnd-root"},
                                               {"--root"},
                                               {"--unknown"},
                                               {"positional"}}) {
        auto parsed = QRNDaemonOptions::parse(bad);
        ASSERT_TRUE(parsed.exitStatus) << bad[0];
        EXPECT_NE(*parsed.exitStatus, 0) << bad[0];
        EXPECT_FALSE(parsed.output.empty()) << bad[0];
    }
}

} // namespace
