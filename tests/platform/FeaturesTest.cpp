#include "Daemon/platform/LinuxFeatures.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

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
