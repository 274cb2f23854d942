// What the platform reads from the root's files: feature switches, host
// flags, the OS release, the first-boot marker; and the container layout.

#include "Daemon/platform/ContainerLibrary.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LinuxFeatures.h"
#include "Daemon/platform/LinuxHostConfig.h"
#include "Daemon/platform/LinuxOsVariant.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <regex>

using namespace quarn;

namespace {

std::string plist(const std::string& body) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
           "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" "
           "\"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
           "<plist version=\"1.0\">" +
           body + "</plist>\n";
}
// Feature `f` whose dictionary holds `body`.
std::string feature(const std::string& body) {
    return plist("<dict><key>f</key>" + body + "</dict>");
}

class FeaturesTest : public quarn::test::TempRootTest {
protected:
    bool isEnabled(std::string_view domain) {
        return root_.context().instance<Features>().isEnabled(domain, "f");
    }
    void writeDomain(const std::string& domain, const std::string& contents) {
        root_.writeFile("/etc/quarnd/features/" + domain + ".plist", contents);
    }
};

} // namespace

TEST_F(FeaturesTest, OnlyAnExplicitTrueInAReadableFileSwitchesAFeatureOn) {
    EXPECT_FALSE(isEnabled("quarnd")); // no file
    const std::string on = "<dict><key>Enabled</key><true/></dict>";
    // In this order: the file is read on each question, so switching off takes effect at once.
    const struct {
        std::string contents;
        bool enabled;
    } cases[] = {
        {feature(on), true},
        {feature("<dict><key>Enabled</key><false/></dict>"), false},
        {feature(on), true},
        {feature("<dict><key>Enabled</key><string>YES</string></dict>"), false},
        {feature("<dict><key>Enabled</key><integer>1</integer></dict>"), false},
        {feature("<true/>"), false},
        {feature("<dict/>"), false},
        {plist("<dict><key>g</key>" + on + "</dict>"), false},
        {"not a property list", false},
        {"", false},
        {plist("<array><string>f</string></array>"), false},
        {plist("<dict><key>f</key>" + on), false},
    };
    for (const auto& c : cases) {
        writeDomain("quarnd", c.contents);
        EXPECT_EQ(isEnabled("quarnd"), c.enabled) << c.contents;
    }
    std::filesystem::remove(root_ / "/etc/quarnd/features/quarnd.plist");
    std::filesystem::create_directory(root_ / "/etc/quarnd/features/quarnd.plist");
    EXPECT_FALSE(isEnabled("quarnd"));
}

TEST_F(FeaturesTest, DomainsCannotReachOutsideTheFeaturesDirectory) {
    const std::string on = feature("<dict><key>Enabled</key><true/></dict>");
    root_.writeFile("/etc/quarnd/escaped.plist", on);
    writeDomain(".hidden", on);
    writeDomain("ok", on);
    EXPECT_TRUE(isEnabled("ok"));
    for (std::string_view domain : {"other", "../escaped", ".hidden", ""}) {
        EXPECT_FALSE(isEnabled(domain)) << domain;
    }
    EXPECT_FALSE(isEnabled(std::string_view("ok\0x", 4)));
}

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

TEST(FirstBootMarkerTest, MarkersOfTwoRootsAreIndependent) {
    quarn::test::TempRoot rootA;
    quarn::test::TempRoot rootB(quarn::test::TempRoot::Options{true, false});
    const FirstBootMarker a(rootA.path());
    const FirstBootMarker b(rootB.path());
    ASSERT_NE(a.name(), b.name());
    EXPECT_TRUE(std::regex_match(a.name(), std::regex("/quarnd\\.fb_check\\.[0-9a-f]{8}")));
    // The same root, spelt with a trailing slash, is the same marker.
    EXPECT_EQ(FirstBootMarker(rootA.path().string() + "/").name(), a.name());
    EXPECT_EQ(FirstBootMarker("/").name(), "/quarnd.fb_check");

    ASSERT_TRUE(a.remove() && b.remove());
    ASSERT_TRUE(a.create());
    ASSERT_TRUE(a.create()) << "creating an existing marker is no error";
    EXPECT_EQ(std::make_pair(a.exists(), b.exists()), std::make_pair(true, false));
    ASSERT_TRUE(b.create());
    ASSERT_TRUE(a.remove());
    ASSERT_TRUE(a.remove()) << "removing an absent marker is no error";
    EXPECT_EQ(std::make_pair(a.exists(), b.exists()), std::make_pair(false, true));
    ASSERT_TRUE(b.remove());
    EXPECT_FALSE(b.exists());
}

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
