#include "Daemon/platform/LinuxOsVariant.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(OsReleaseParsing, ShellQuotingAndLayoutNoiseAreUnderstoodAndMalformedLinesSkipped) {
    using Fields = LinuxOsVariant::Fields;
    EXPECT_TRUE(LinuxOsVariant::parseOsRelease("").empty());
    EXPECT_EQ(LinuxOsVariant::parseOsRelease("A=plain\n"
                                             "B=\"two words\"\n"
                                             "C='single \"quoted\" \\n kept'\n"
                                             "D=\"esc \\\" \\\\ \\$ \\` and \\n kept\"\n"
                                             "E=bare\\ escaped\\\\\n"
                                             "F=\"\"\n"
                                             "G=\n"
                                             "H=\"a=b\"\n"
                                             "I=trailing\\\n"
                                             "J=\"ends in escaped quote\\\"\"\n"
                                             "# comment=ignored\n"
                                             "\n"
                                             "   \t\n"
                                             "  SPACED  =  \"value\"  \r\n"
                                             "CRLF=yes\r\n"
                                             "X=first\n"
                                             "X=second\n"
                                             "no equals sign\n"
                                             "=novalue\n"
                                             "1KEY=digit first\n"
                                             "BAD-KEY=dash\n"
                                             "OPEN=\"never closed\n"
                                             "OPEN1='never closed either\n"
                                             "JOINED=\"a\"'b'\n"
                                             "AFTER=\"x\" junk\n"
                                             "ESCAPED_END=\"x\\\"\n"
                                             "KEY_2=ok\n"
                                             "LAST=no-newline"),
              (Fields{{"A", "plain"},
                      {"B", "two words"},
                      {"C", "single \"quoted\" \\n kept"},
                      {"D", "esc \" \\ $ ` and \\n kept"},
                      {"E", "bare escaped\\"},
                      {"F", ""},
                      {"G", ""},
                      {"H", "a=b"},
                      {"I", "trailing"},
                      {"J", "ends in escaped quote\""},
                      {"SPACED", "value"},
                      {"CRLF", "yes"},
                      {"X", "second"},
                      {"KEY_2", "ok"},
                      {"LAST", "no-newline"}}));
}

namespace {

class OsVariantOnRoot : public quarn::test::TempRootTest {
protected:
    OsVariant& variant() { return root_.context().instance<OsVariant>(); }
    bool internal() { return variant().hasInternalContent("com.orvex.quarnd"); }
};

} // namespace

TEST_F(OsVariantOnRoot, VersionDictionaryAndInternalFlagComeFromOsRelease) {
    root_.writeFile("/etc/os-release", "NAME=\"Orvex OS\"\nVERSION_ID=\"4.2\"\n"
                                       "BUILD_ID='21A5248v'\nVARIANT_ID=internal\n");
    EXPECT_TRUE(internal());
    EXPECT_TRUE(variant().hasInternalContent("anything.else"));
    EXPECT_EQ(variant().versionDictionary(),
              Value(Value::Dictionary{
                  {"BuildID", "21A5248v"}, {"VersionID", "4.2"}, {"VariantID", "internal"}}));
    EXPECT_EQ(variant().buildVersion(), "21A5248v");

    // Changes are seen without a restart of the daemon's platform.
    root_.writeFile("/etc/os-release", "VARIANT_ID=\"internal-debug\"\nVERSION_ID=5\n");
    EXPECT_FALSE(internal());
    EXPECT_EQ(variant().versionDictionary(),
              Value(Value::Dictionary{{"VersionID", "5"}, {"VariantID", "internal-debug"}}));
    EXPECT_FALSE(variant().buildVersion());
    root_.writeFile("/etc/os-release", "VARIANT_ID=\"internal\"\n");
    EXPECT_TRUE(internal());
    root_.writeFile("/etc/os-release", "VARIANT_ID=Internal\n");
    EXPECT_FALSE(internal());
}

TEST_F(OsVariantOnRoot, FallsBackToTheVendorFileFollowsTheUsualLinkAndIgnoresNonFiles) {
    EXPECT_FALSE(internal());
    EXPECT_EQ(variant().versionDictionary(), Value::dictionary());
    EXPECT_FALSE(variant().buildVersion());

    root_.writeFile("/usr/lib/os-release", "BUILD_ID=vendor\nVARIANT_ID=internal\n");
    EXPECT_EQ(variant().buildVersion(), "vendor");
    std::filesystem::create_symlink("../usr/lib/os-release", root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=linked\n");
    EXPECT_EQ(variant().buildVersion(), "linked");

    // Something other than a file counts as no answer, without falling back.
    std::filesystem::remove(root_ / "/etc/os-release");
    std::filesystem::create_directories(root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=vendor\nVARIANT_ID=internal\n");
    EXPECT_FALSE(internal());
    EXPECT_FALSE(variant().buildVersion());
}
