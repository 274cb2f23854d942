#include "Daemon/platform/LinuxAccounts.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <string>

using namespace quarn;

namespace {

class AccountsOnTempRoot : public quarn::test::TempRootTest {
protected:
    LinuxAccounts accounts() const { return LinuxAccounts(Paths(root_.path())); }
};

} // namespace

TEST_F(AccountsOnTempRoot, FindsTheRootsOwnUsersAndGroupsWithHomesBelowTheRoot) {
    auto& installed = root_.context().instance<Accounts>();
    auto mobile = installed.userByName("mobile");
    ASSERT_TRUE(mobile);
    EXPECT_EQ(std::tie(mobile->uid, mobile->gid), std::make_tuple(501u, 501u));
    EXPECT_EQ(mobile->homeDirectory, root_.path() / "private/var/mobile");
    EXPECT_EQ(installed.userByUID(501)->name, "mobile");
    // uid 0 of the temp root, not of the host.
    EXPECT_EQ(installed.userByUID(0)->homeDirectory, root_.path() / "private/var/root");
    EXPECT_EQ(installed.userByName("_installd")->uid, 33u);
    EXPECT_FALSE(installed.userByUID(4242));
    for (std::string_view name : std::initializer_list<std::string_view>{
             "nobody-here", "", "mobil", std::string_view("mobile\0x", 8)}) {
        EXPECT_FALSE(installed.userByName(name)) << name;
    }

    auto group = installed.groupByName("systemusers");
    ASSERT_TRUE(group);
    EXPECT_EQ(group->gid, quarn::test::kSystemUsersGID);
    EXPECT_EQ(group->members, std::vector<std::string>{"mobile"});
    EXPECT_EQ(installed.groupByGID(quarn::test::kSystemUsersGID)->name, "systemusers");
    EXPECT_TRUE(installed.groupByGID(0)->members.empty());
    EXPECT_FALSE(installed.groupByName("staff"));
    EXPECT_FALSE(installed.groupByGID(7777));
    EXPECT_FALSE(installed.groupByName(""));
}

TEST_F(AccountsOnTempRoot, SkipsMalformedLinesAndHomesOutsideTheRoot) {
    root_.writeFile("/etc/passwd", "garbage without colons\n"
                                   "\n"
                                   "nouid:x::5:x:/h:/bin/sh\n"
                                   "alpha:x:12a:5:x:/h:/bin/sh\n"
                                   "huge:x:99999999999:5:x:/h:/bin/sh\n"
                                   "short:x:7\n"
                                   ":x:9:9::/empty-name:/bin/sh\n"
                                   "+compat:x:10:10::/p:/bin/sh\n"
                                   "mobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n"
                                   "twin:x:501:20::/second:/bin/sh\n"
                                   "escape:x:600:600::/private/../../../etc:/bin/sh\n"
                                   "nohome:x:601:601\n"
                                   "emptyhome:x:602:602:::\n"
                                   "relative:x:603:603::var/rel:/bin/sh\n");
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
    for (uid_t uid : {9, 10, 12}) { // nameless, compat marker, bad uid
        EXPECT_FALSE(a.userByUID(uid)) << uid;
    }
    EXPECT_EQ(a.groupByGID(1501)->name, "systemusers");
    EXPECT_EQ(a.groupByGID(1501)->members, (std::vector<std::string>{"mobile", "other"}));
    EXPECT_FALSE(a.groupByName("nogid"));

    // Homes that leave the root or are missing are empty.
    for (const char* name : {"escape", "nohome", "emptyhome"}) {
        ASSERT_TRUE(a.userByName(name)) << name;
        EXPECT_TRUE(a.userByName(name)->homeDirectory.empty()) << name;
    }
    EXPECT_EQ(a.userByName("relative")->homeDirectory, root_.path() / "var/rel");
}

TEST_F(AccountsOnTempRoot, EntriesLongerThanTheFirstBufferAreReadWhole) {
    std::vector<std::string> many; // ~80 KiB on one line
    std::string line = "crowd:x:11:";
    for (int i = 0; i < 3000; ++i) {
        many.push_back("member-with-a-long-name-" + std::to_string(i));
        line += (i ? "," : "") + many.back();
    }
    root_.writeFile("/etc/group", "before:x:10:a\n" + line + "\nafter:x:12:b\n");
    const std::string longHome = "/private/var/" + std::string(5000, 'h');
    root_.writeFile("/etc/passwd",
                    "long:x:700:700::" + longHome + ":/bin/sh\nnext:x:701:701::/n:\n");
    auto a = accounts();
    EXPECT_EQ(a.groupByName("crowd")->members, many);
    EXPECT_EQ(a.groupByGID(12)->name, "after"); // the reader did not lose its place
    EXPECT_EQ(a.userByUID(700)->homeDirectory, root_ / longHome);
    EXPECT_EQ(a.userByName("next")->uid, 701u);
}

TEST_F(AccountsOnTempRoot, MissingOrUnreadableFilesAnswerNothing) {
    std::filesystem::remove(root_ / "/etc/passwd");
    std::filesystem::remove(root_ / "/etc/group");
    auto a = accounts();
    EXPECT_FALSE(a.userByName("mobile"));
    EXPECT_FALSE(a.userByUID(0));
    EXPECT_FALSE(a.groupByName("systemusers"));
    EXPECT_FALSE(a.groupByGID(0));
    std::filesystem::create_directory(root_ / "/etc/passwd");
    EXPECT_FALSE(a.userByName("mobile"));
}

TEST(AccountsOnSystemRoot, AsksTheNameServiceAndLeavesHomesAlone) {
    LinuxAccounts a{Paths("/")};
    auto root = a.userByUID(0);
    ASSERT_TRUE(root);
    EXPECT_EQ(std::tie(root->name, root->gid), std::make_tuple("root", 0u));
    EXPECT_EQ(root->homeDirectory.string().substr(0, 1), "/");
    EXPECT_EQ(a.userByName("root")->uid, 0u);
    auto wheel = a.groupByGID(0);
    ASSERT_TRUE(wheel);
    EXPECT_EQ(a.groupByName(wheel->name)->gid, 0u);
    EXPECT_FALSE(a.userByName("no-such-user-quarn"));
    EXPECT_FALSE(a.groupByName("no-such-group-quarn"));
}
