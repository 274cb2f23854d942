#include "Daemon/platform/LinuxAccounts.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <string>

using namespace quarn;
using quarn::test::TempRoot;

namespace {

class AccountsOnTempRoot : public quarn::test::TempRootTest {
protected:
    LinuxAccounts accounts() const { return LinuxAccounts(Paths(root_.path())); }
};

std::vector<std::string> membersNamed(const std::string& prefix, int count) {
    std::vector<std::string> names;
    for (int i = 0; i < count; ++i) {
        names.push_back(prefix + std::to_string(i));
    }
    return names;
}

std::string joined(const std::vector<std::string>& names) {
    std::string out;
    for (const auto& n : names) {
        out += (out.empty() ? "" : ",") + n;
    }
    return out;
}

} // namespace

TEST_F(AccountsOnTempRoot, FindsTheRootsOwnUsersWithHomesBelowTheRoot) {
    auto& installed = root_.context().instance<Accounts>();
    auto byName = installed.userByName("mobile");
    ASSERT_TRUE(byName);
    EXPECT_EQ(byName->uid, 501u);
    EXPECT_EQ(byName->gid, 501u);
    EXPECT_EQ(byName->homeDirectory, root_.path() / "private/var/mobile");

    auto byUID = installed.userByUID(501);
    ASSERT_TRUE(byUID);
    EXPECT_EQ(byUID->name, "mobile");
    // uid 0 of the temp root, not of the host.
    auto root = installed.userByUID(0);
    ASSERT_TRUE(root);
    EXPECT_EQ(root->homeDirectory, root_.path() / "private/var/root");
    auto installer = installed.userByName("_installd");
    ASSERT_TRUE(installer);
    EXPECT_EQ(installer->uid, 33u);

    EXPECT_FALSE(installed.userByName("nobody-here"));
    EXPECT_FALSE(installed.userByUID(4242));
    EXPECT_FALSE(installed.userByName(""));
    EXPECT_FALSE(installed.userByName(std::string_view("mobile\0x", 8)));
    EXPECT_FALSE(installed.userByName("mobil"));
}

TEST_F(AccountsOnTempRoot, FindsGroupsWithTheirMembers) {
    auto a = accounts();
    auto byName = a.groupByName("systemusers");
    ASSERT_TRUE(byName);
    EXPECT_EQ(byName->gid, quarn::test::kSystemUsersGID);
    EXPECT_EQ(byName->members, std::vector<std::string>{"mobile"});

    auto byGID = a.groupByGID(quarn::test::kSystemUsersGID);
    ASSERT_TRUE(byGID);
    EXPECT_EQ(byGID->name, "systemusers");
    EXPECT_TRUE(a.groupByGID(0)->members.empty());

    EXPECT_FALSE(a.groupByName("staff"));
    EXPECT_FALSE(a.groupByGID(7777));
    EXPECT_FALSE(a.groupByName(""));
}

TEST_F(AccountsOnTempRoot, SkipsMalformedLinesAndKeepsReading) {
    root_.writeFile("/etc/passwd", "garbage without colons\n"
                                   "\n"
                                   "nouid:x::5:x:/h:/bin/sh\n"
                                   "alpha:x:12a:5:x:/h:/bin/sh\n"
                                   "huge:x:99999999999:5:x:/h:/bin/sh\n"
                                   "short:x:7\n"
                                   ":x:9:9::/empty-name:/bin/sh\n"
                                   "+compat:x:10:10::/p:/bin/sh\n"
                                   "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n"
                                   "twin:x:501:20::/second:/bin/sh\n");
    root_.writeFile("/etc/group", "bad\n"
                                  "nogid:x::a,b\n"
                                  ":x:1501:ghost\n"
                                  "systemusers:x:1501:mobile,,other,\n");
    auto a = accounts();
    EXPECT_EQ(a.userByName("mobile")->uid, 501u);
    EXPECT_EQ(a.userByUID(501)->name, "mobile"); // the first entry of a uid wins
    EXPECT_EQ(a.userByName("twin")->gid, 20u);
    for (const char* name : {"nouid", "alpha", "huge", "short", "+compat", "compat", "garbage"}) {
        EXPECT_FALSE(a.userByName(name)) << name;
    }
    EXPECT_FALSE(a.userByUID(9));  // nameless entry
    EXPECT_FALSE(a.userByUID(10)); // compat marker
    EXPECT_FALSE(a.userByUID(12));

    auto group = a.groupByGID(1501);
    ASSERT_TRUE(group);
    EXPECT_EQ(group->name, "systemusers");
    EXPECT_EQ(group->members, (std::vector<std::string>{"mobile", "other"}));
    EXPECT_FALSE(a.groupByName("nogid"));
}

TEST_F(AccountsOnTempRoot, HomesThatLeaveTheRootOrAreMissingAreEmpty) {
    root_.writeFile("/etc/passwd", "escape:x:600:600::/private/../../../etc:/bin/sh\n"
                                   "nohome:x:601:601\n"
                                   "emptyhome:x:602:602:::\n"
                                   "relative:x:603:603::var/rel:/bin/sh\n");
    auto a = accounts();
    ASSERT_TRUE(a.userByUID(600));
    EXPECT_TRUE(a.userByUID(600)->homeDirectory.empty());
    EXPECT_TRUE(a.userByName("nohome")->homeDirectory.empty());
    EXPECT_TRUE(a.userByName("emptyhome")->homeDirectory.empty());
    EXPECT_EQ(a.userByName("relative")->homeDirectory, root_.path() / "var/rel");
}

TEST_F(AccountsOnTempRoot, EntriesLongerThanTheFirstBufferAreReadWhole) {
    auto many = membersNamed("member-with-a-long-name-", 3000); // ~80 KiB on one line
    root_.writeFile("/etc/group", "before:x:10:a\n"
                                  "crowd:x:11:" +
                                      joined(many) +
                                      "\n"
                                      "after:x:12:b\n");
    const std::string longHome = "/private/var/" + std::string(5000, 'h');
    root_.writeFile("/etc/passwd",
                    "long:x:700:700::" + longHome + ":/bin/sh\nnext:x:701:701::/n:\n");
    auto a = accounts();
    auto crowd = a.groupByName("crowd");
    ASSERT_TRUE(crowd);
    EXPECT_EQ(crowd->members, many);
    EXPECT_EQ(a.groupByGID(12)->name, "after"); // the reader did not lose its place
    EXPECT_EQ(a.userByUID(700)->homeDirectory, root_ / longHome);
    EXPECT_EQ(a.userByName("next")->uid, 701u);
}

TEST(AccountsMissingFiles, AnswerNothing) {
    TempRoot root;
    std::filesystem::remove(root / "/etc/passwd");
    std::filesystem::remove(root / "/etc/group");
    LinuxAccounts a{Paths(root.path())};
    EXPECT_FALSE(a.userByName("mobile"));
    EXPECT_FALSE(a.userByUID(0));
    EXPECT_FALSE(a.groupByName("systemusers"));
    EXPECT_FALSE(a.groupByGID(0));

    std::filesystem::create_directory(root / "/etc/passwd"); // unreadable as a file
    EXPECT_FALSE(a.userByName("mobile"));
}

TEST(AccountsOnSystemRoot, AsksTheNameServiceAndLeavesHomesAlone) {
    LinuxAccounts a{Paths("/")};
    auto root = a.userByUID(0);
    ASSERT_TRUE(root);
    EXPECT_EQ(root->name, "root");
    EXPECT_EQ(root->gid, 0u);
    EXPECT_FALSE(root->homeDirectory.empty());
    EXPECT_EQ(root->homeDirectory.string().front(), '/');
    EXPECT_EQ(a.userByName("root")->uid, 0u);
    auto wheel = a.groupByGID(0);
    ASSERT_TRUE(wheel);
    EXPECT_EQ(a.groupByName(wheel->name)->gid, 0u);
    EXPECT_FALSE(a.userByName("no-such-user-quarn"));
    EXPECT_FALSE(a.groupByName("no-such-group-quarn"));
}
