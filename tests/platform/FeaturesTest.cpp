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

class FeaturesTest : public quarn::test::TempRootTest {
protected:
    Features& features() { return root_.context().instance<Features>(); }
    void writeDomain(const std::string& domain, const std::string& contents) {
        root_.writeFile("/etc/quarnd/features/" + domain + ".plist", contents);
    }
};

} // namespace

TEST_F(FeaturesTest, OnlyAnExplicitTrueSwitchesAFeatureOn) {
    EXPECT_FALSE(features().isEnabled("quarnd", "fast_container_sizing")); // no file
    writeDomain("quarnd",
                plist("<dict>"
                      "<key>fast_container_sizing</key><dict><key>Enabled</key><true/></dict>"
                      "<key>off</key><dict><key>Enabled</key><false/></dict>"
                      "<key>as_string</key><dict><key>Enabled</key><string>YES</string></dict>"
                      "<key>as_number</key><dict><key>Enabled</key><integer>1</integer></dict>"
                      "<key>no_dict</key><true/>"
                      "<key>no_key</key><dict/>"
                      "</dict>"));
    EXPECT_TRUE(features().isEnabled("quarnd", "fast_container_sizing"));
    for (const char* feature : {"off", "as_string", "as_number", "no_dict", "no_key", "unknown"}) {
        EXPECT_FALSE(features().isEnabled("quarnd", feature)) << feature;
    }
    EXPECT_FALSE(features().isEnabled("other", "fast_container_sizing")); // per domain

    // The file is read on each question: switching off takes effect at once.
    writeDomain("quarnd", plist("<dict><key>fast_container_sizing</key>"
                                "<dict><key>Enabled</key><false/></dict></dict>"));
    EXPECT_FALSE(features().isEnabled("quarnd", "fast_container_sizing"));
}

TEST_F(FeaturesTest, BrokenFilesMeanOff) {
    for (const std::string& contents :
         {std::string("not a property list"), std::string(),
          plist("<array><string>fast_container_sizing</string></array>"),
          plist("<dict><key>fast_container_sizing</key><dict><key>Enabled</key><true/>")}) {
        writeDomain("quarnd", contents);
        EXPECT_FALSE(features().isEnabled("quarnd", "fast_container_sizing")) << contents;
    }
    std::filesystem::remove(root_ / "/etc/quarnd/features/quarnd.plist");
    std::filesystem::create_directory(root_ / "/etc/quarnd/features/quarnd.plist");
    EXPECT_FALSE(features().isEnabled("quarnd", "fast_container_sizing"));
}

TEST_F(FeaturesTest, DomainsCannotReachOutsideTheFeaturesDirectory) {
    const std::string on = plist("<dict><key>f</key><dict><key>Enabled</key><true/></dict></dict>");
    root_.writeFile("/etc/quarnd/escaped.plist", on);
    writeDomain(".hidden", on);
    writeDomain("ok", on);
    EXPECT_TRUE(features().isEnabled("ok", "f"));
    EXPECT_FALSE(features().isEnabled("../escaped", "f"));
    EXPECT_FALSE(features().isEnabled(".hidden", "f"));
    EXPECT_FALSE(features().isEnabled("", "f"));
    EXPECT_FALSE(features().isEnabled(std::string_view("ok\0x", 4), "f"));
}
