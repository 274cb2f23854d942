#include "Daemon/support/Signpost.h"
#include "common/LogCapture.h"

#include <gtest/gtest.h>

#include <fstream>
#include <regex>
#include <string>

using namespace quarn;
using quarn::test::LogCapture;

namespace {

std::string tag(const Signpost& s) {
    return s.name() + " [" + std::to_string(s.identifier()) + "]";
}

} // namespace

TEST(Signpost, LogsBeginAndEndWithDurationOnce) {
    LogCapture log;
    std::string id;
    {
        Signpost s(LogCategory::Startup, "BootSetup", "first boot");
        id = tag(s);
        EXPECT_TRUE(log.contains(id + " begin: first boot"));
        EXPECT_EQ(log.count(id + " end"), 0u);
        s.end("12 nodes");
        EXPECT_FALSE(s.isActive());
        s.end("again");
    }
    ASSERT_EQ(log.count(id + " end"), 1u) << log.all();
    std::regex endLine(std::regex_replace(id, std::regex(R"([\[\]])"), R"(\$&)") +
                       R"( end after \d+\.\d{3} ms: 12 nodes)");
    bool matched = false;
    for (const auto& m : log.messages()) {
        matched = matched || std::regex_search(m, endLine);
    }
    EXPECT_TRUE(matched) << log.all();
}

TEST(Signpost, IntervalsAreToldApartAndMovesEndOnce) {
    LogCapture log;
    Signpost a(LogCategory::Vell, "VellEventProcessing");
    Signpost b(LogCategory::Vell, "VellEventProcessing");
    EXPECT_NE(a.identifier(), b.identifier());
    std::string aTag = tag(a), bTag = tag(b);
    {
        Signpost moved(std::move(a));
        EXPECT_FALSE(a.isActive());
        // Assigning over b ends b's own interval first.
        b = std::move(moved);
        EXPECT_EQ(log.count(bTag + " end"), 1u);
        EXPECT_EQ(log.count(aTag + " end"), 0u);
    }
    EXPECT_EQ(log.count(aTag + " end"), 0u) << "a moved-from signpost must not end";
    b.end();
    EXPECT_EQ(log.count(aTag + " end"), 1u);
    EXPECT_EQ(log.count(bTag + " end"), 1u);
}

#if __has_include(<sys/sdt.h>)
TEST(Signpost, ProbesAreInTheBinary) {
    // USDT probes leave "provider\0name" in the binary's stapsdt notes.
    std::ifstream exe("/proc/self/exe", std::ios::binary | std::ios::ate);
    std::string bytes(static_cast<std::size_t>(exe.tellg()), '\0');
    exe.seekg(0);
    exe.read(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    using namespace std::string_literals;
    EXPECT_NE(bytes.find("quarnd\0signpost_begin\0"s), std::string::npos);
    EXPECT_NE(bytes.find("quarnd\0signpost_end\0"s), std::string::npos);
}
#endif
