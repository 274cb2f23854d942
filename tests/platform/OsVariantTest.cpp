#include "Daemon/platform/LinuxOsVariant.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

namespace {
using Fields = LinuxOsVariant::Fields;
Fields parse(std::string_view text) {
    return LinuxOsVariant::parseOsRelease(text);
}
} // namespace

TEST(OsReleaseParsing, QuotingFollowsShellRules) {
    const auto f = parse("A=plain\n"
                         "B=\"two words\"\n"
                         "C='single \"quoted\" \\n kept'\n"
                         "D=\"esc \\\" \\\\ \\$ \\` and \\n kept\"\n"
                         "E=bare\\ escaped\\\\\n"
                         "F=\"\"\n"
                         "G=\n"
                         "H=\"a=b\"\n"
                         "I=trailing\\\n"
                         "J=\"ends in escaped quote\\\"\"\n");
    EXPECT_EQ(f.at("A"), "plain");
    EXPECT_EQ(f.at("B"), "two words");
    EXPECT_EQ(f.at("C"), "single \"quoted\" \\n kept");
    EXPECT_EQ(f.at("D"), "esc \" \\ $ ` and \\n kept");
    EXPECT_EQ(f.at("E"), "bare escaped\\");
    EXPECT_EQ(f.at("F"), "");
    EXPECT_EQ(f.at("G"), "");
    EXPECT_EQ(f.at("H"), "a=b");
    EXPECT_EQ(f.at("I"), "trailing");
    EXPECT_EQ(f.at("J"), "ends in escaped quote\"");
}

TEST(OsReleaseParsing, LayoutNoiseIsTolerated) {
    const auto f = parse("# comment=ignored\n"
                         "\n"
                         "   \t\n"
                         "  SPACED  =  \"value\"  \r\n"
                         "CRLF=yes\r\n"
                         "X=first\n"
                         "X=second\n"
                         "LAST=no-newline");
    EXPECT_FALSE(f.count("# comment"));
    EXPECT_EQ(f.at("SPACED"), "value");
    EXPECT_EQ(f.at("CRLF"), "yes");
    EXPECT_EQ(f.at("X"), "second");
    EXPECT_EQ(f.at("LAST"), "no-newline");
    EXPECT_EQ(f.size(), 4u);
    EXPECT_TRUE(parse("").empty());
}

TEST(OsReleaseParsing, MalformedLinesAreSkippedNotFatal) {
    const auto f = parse("no equals sign\n"
                         "=novalue\n"
                         "1KEY=digit first\n"
                         "BAD-KEY=dash\n"
                         "OPEN=\"never closed\n"
                         "OPEN1='never closed either\n"
                         "JOINED=\"a\"'b'\n"
                         "AFTER=\"x\" junk\n"
                         "ESCAPED_END=\"x\\\"\n"
                         "GOOD=kept\n"
                         "KEY_2=ok\n");
    EXPECT_EQ(f, (Fields{{"GOOD", "kept"}, {"KEY_2", "ok"}}));
}

class OsVariantOnRoot : public quarn::test::TempRootTest {
protected:
    OsVariant& variant() { return root_.context().instance<OsVariant>(); }
};

TEST_F(OsVariantOnRoot, VersionDictionaryAndInternalFlagComeFromOsRelease) {
    root_.writeFile("/etc/os-release", "NAME=\"Orvex OS\"\n"
                                       "VERSION_ID=\"4.2\"\n"
                                       "BUILD_ID='21A5248v'\n"
                                       "VARIANT_ID=internal\n");
    EXPECT_TRUE(variant().hasInternalContent("com.orvex.quarnd"));
    EXPECT_TRUE(variant().hasInternalContent("anything.else"));
    EXPECT_EQ(variant().versionDictionary(),
              Value(Value::Dictionary{
                  {"BuildID", "21A5248v"}, {"VersionID", "4.2"}, {"VariantID", "internal"}}));
    EXPECT_EQ(variant().buildVersion(), "21A5248v");

    // Changes are seen without a restart of the daemon's platform.
    root_.writeFile("/etc/os-release", "VARIANT_ID=\"internal-debug\"\nVERSION_ID=5\n");
    EXPECT_FALSE(variant().hasInternalContent("com.orvex.quarnd"));
    EXPECT_EQ(variant().versionDictionary(),
              Value(Value::Dictionary{{"VersionID", "5"}, {"VariantID", "internal-debug"}}));
    EXPECT_FALSE(variant().buildVersion());

    root_.writeFile("/etc/os-release", "VARIANT_ID=\"internal\"\n");
    EXPECT_TRUE(variant().hasInternalContent("com.orvex.quarnd"));
    root_.writeFile("/etc/os-release", "VARIANT_ID=Internal\n");
    EXPECT_FALSE(variant().hasInternalContent("com.orvex.quarnd"));
}

TEST_F(OsVariantOnRoot, FallsBackToTheVendorFileAndFollowsTheUsualLink) {
    EXPECT_FALSE(variant().hasInternalContent("com.orvex.quarnd"));
    EXPECT_EQ(variant().versionDictionary(), Value::dictionary());
    EXPECT_FALSE(variant().buildVersion());

    root_.writeFile("/usr/lib/os-release", "BUILD_ID=vendor\n");
    EXPECT_EQ(variant().buildVersion(), "vendor");

    std::filesystem::create_symlink("../usr/lib/os-release", root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=linked\n");
    EXPECT_EQ(variant().buildVersion(), "linked");
}

TEST_F(OsVariantOnRoot, SomethingOtherThanAFileCountsAsNoAnswer) {
    std::filesystem::create_directories(root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=vendor\nVARIANT_ID=internal\n");
    EXPECT_FALSE(variant().hasInternalContent("com.orvex.quarnd"));
    EXPECT_FALSE(variant().buildVersion());
}
