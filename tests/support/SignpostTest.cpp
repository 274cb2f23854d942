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

TEST(Signpost, LogsBeginAndEndWithDurationOnceAndMovesEndOnce) {
    LogCapture log;
    std::string id;
    {
        Signpost s(LogCategory::Startup, "BootSetup", "first boot");
        id = tag(s);
        EXPECT_TRUE(log.contains(id + " begin: first boot"));
        EXPECT_EQ(log.count(id + " end"), 0u);
        s.end("12 nodes");
        s.end("again");
    }
    ASSERT_EQ(log.count(id + " end"), 1u) << log.all();
    EXPECT_TRUE(std::regex_search(log.all(), std::regex(R"( end after \d+\.\d{3} ms: 12 nodes)")))
        << log.all();

    // Intervals are told apart, and a moved one ends once.
    Signpost a(LogCategory::Vell, "VellEventProcessing");
    Signpost b(LogCategory::Vell, "VellEventProcessing");
    std::string aTag = tag(a), bTag = tag(b);
    EXPECT_NE(aTag, bTag);
    {
        Signpost moved(std::move(a));
        b = std::move(moved); // ends b's own interval first
        EXPECT_EQ(log.count(bTag + " end"), 1u);
    }
    EXPECT_EQ(log.count(aTag + " end"), 0u) << "a moved-from signpost must not end";
    b.end();
    EXPECT_EQ(log.count(aTag + " end"), 1u);
    EXPECT_EQ(log.count(bTag + " end"), 1u);
}

#if __has_include(<sys/sdt.h>)
TEST(Signpost, ProbesAreInTheBinary) {
    // USDT probes leave "provider\0name" in the binary's stapsdt notes.
    std::ifstream exe("/proc/self/exe", std::ios::binary);
    std::string bytes(std::istreambuf_iterator<char>(exe), {});
    using namespace std::string_literals;
    EXPECT_NE(bytes.find("quarnd\0signpost_begin\0"s), std::string::npos);
    EXPECT_NE(bytes.find("quarnd\0signpost_end\0"s), std::string::npos);
}
#endif
