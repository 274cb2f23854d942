#include "Daemon/platform/LinuxOsVariant.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;

TEST(OsReleaseParsing, ShellQuotingAndLayoutNoiseAreUnderstoodAndMalformedLinesSkipped) {
    EXPECT_TRUE(LinuxOsVariant::parseOsRelease("").empty());
    // Lines of one file, the key each names and its value (none: skipped).
    const struct {
        const char* lines;
        const char* key;
        std::optional<std::string> value;
    } cases[] = {
        {"A=plain", "A", "plain"},
        {"B=\"two words\"", "B", "two words"},
        {"C='single \"quoted\" \\n kept'", "C", "single \"quoted\" \\n kept"},
        {"D=\"esc \\\" \\\\ \\$ \\` and \\n kept\"", "D", "esc \" \\ $ ` and \\n kept"},
        {"E=bare\\ escaped\\\\", "E", "bare escaped\\"},
        {"F=\"\"", "F", ""},
        {"G=", "G", ""},
        {"H=\"a=b\"", "H", "a=b"},
        {"I=trailing\\", "I", "trailing"},
        {"J=\"ends in escaped quote\\\"\"", "J", "ends in escaped quote\""},
        {"# comment=ignored\n\n   \t", "# comment", {}},
        {"  SPACED  =  \"value\"  \r", "SPACED", "value"},
        {"CRLF=yes\r", "CRLF", "yes"},
        {"X=first\nX=second", "X", "second"},
        {"no equals sign\n=novalue", "", {}},
        {"1KEY=digit first", "1KEY", {}},
        {"BAD-KEY=dash", "BAD-KEY", {}},
        {"OPEN=\"never closed", "OPEN", {}},
        {"OPEN1='never closed either", "OPEN1", {}},
        {"JOINED=\"a\"'b'", "JOINED", {}},
        {"AFTER=\"x\" junk", "AFTER", {}},
        {"ESCAPED_END=\"x\\\"", "ESCAPED_END", {}},
        {"KEY_2=ok", "KEY_2", "ok"},
        {"LAST=no-newline", "LAST", "no-newline"}, // last, without a newline
    };
    std::string text;
    std::size_t kept = 0;
    for (const auto& c : cases) {
        text += (text.empty() ? "" : "\n") + std::string(c.lines);
        kept += c.value.has_value();
    }
    const auto fields = LinuxOsVariant::parseOsRelease(text);
    EXPECT_EQ(fields.size(), kept);
    for (const auto& c : cases) {
        const auto found = fields.find(c.key);
        EXPECT_EQ(found == fields.end() ? std::nullopt : std::optional(found->second), c.value)
            << c.lines;
    }
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
