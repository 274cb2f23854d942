// What the platform reads from and writes to the root's files: feature
// switches, host flags, the OS release, the first-boot marker, accounts, the
// lock state and notifications; and the container layout.

#include "Daemon/platform/ContainerLibrary.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LinuxAccounts.h"
#include "Daemon/platform/LinuxFeatures.h"
#include "Daemon/platform/LinuxHostConfig.h"
#include "Daemon/platform/LinuxLockState.h"
#include "Daemon/platform/LinuxNotifications.h"
#include "Daemon/platform/LinuxOsVariant.h"
#include "Daemon/support/Descriptor.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <condition_variable>
#include <cstring>
#include <fstream>
#include <functional>
#include <mutex>
#include <regex>
#include <string>
#include <vector>

using namespace quarn;

namespace {

std::string plist(const std::string& body) {
    return "<plist version=\"1.0\">" + body + "</plist>\n";
}
// Feature `f` whose dictionary holds `body`.
std::string feature(const std::string& body) {
    return plist("<dict><key>f</key>" + body + "</dict>");
}

using RootFilesTest = quarn::test::TempRootTest;

using V = std::vector<std::int32_t>;

// Collects the states a watch reports (it is the callback), for tests to wait on.
struct Reports {
    void operator()(std::int32_t state) {
        std::lock_guard guard(mutex);
        states.push_back(state);
        changed.notify_all();
    }
    // Waits (generously) until `count` states arrived; 0 answers at once.
    V waitFor(std::size_t count = 0) {
        std::unique_lock lock(mutex);
        changed.wait_for(lock, std::chrono::seconds(20), [&] { return states.size() >= count; });
        return states;
    }
    std::mutex mutex; // guards states
    std::condition_variable changed;
    V states;
};

const std::string kLockFile = "/private/var/run/quarnd/lockstate";

std::string contentsOf(const std::filesystem::path& file) {
    std::ifstream in(file);
    return {std::istreambuf_iterator<char>(in), {}};
}

} // namespace

TEST_F(RootFilesTest, OnlyAnExplicitTrueInAFeatureFileOfItsDirectorySwitchesAFeatureOn) {
    const auto isEnabled = [&](std::string_view domain) {
        return root_.context().instance<Features>().isEnabled(domain, "f");
    };
    const auto writeDomain = [&](const std::string& domain, const std::string& contents) {
        root_.writeFile("/etc/quarnd/features/" + domain + ".plist", contents);
    };
    EXPECT_FALSE(isEnabled("quarnd")); // no file
    const std::string on = "<dict><key>Enabled</key><true/></dict>";
    // In this order: the file is read on each question, so switching off takes effect at once.
    const struct {
        std::string contents;
        bool enabled;
    } cases[] = {
        {feature(on), true},
        {feature("<dict><key>Enabled</key><false/></dict>"), false},
        {feature("<dict><key>Enabled</key><string>YES</string></dict>"), false},
        {feature("<dict><key>Enabled</key><integer>1</integer></dict>"), false},
        {feature("<true/>"), false},
        {feature("<dict/>"), false},
        {plist("<dict><key>g</key>" + on + "</dict>"), false},
        {"not a property list", false},
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

    // Domains cannot reach outside the features directory.
    root_.writeFile("/etc/quarnd/escaped.plist", feature(on));
    writeDomain(".hidden", feature(on));
    writeDomain("ok", feature(on));
    EXPECT_TRUE(isEnabled("ok"));
    for (std::string_view domain : {"other", "../escaped", ".hidden", ""}) {
        EXPECT_FALSE(isEnabled(domain)) << domain;
    }
    EXPECT_FALSE(isEnabled(std::string_view("ok\0x", 4)));
}

TEST_F(RootFilesTest, HostFlagsAreOnlyOneUnsigned32BitDecimalInTheRootsConfigFile) {
    const std::pair<const char*, std::optional<std::uint32_t>> cases[] = {
        {"0", 0},    {" \t5\n", 5}, {"0010", 10},       {"4294967295", 4294967295u},
        {"", {}},    {"  \n", {}},  {"4294967296", {}}, {"-1", {}},
        {"+1", {}},  {"0x10", {}},  {"1 2", {}},        {"12abc", {}},
        {"1.0", {}},
    };
    for (const auto& [text, expected] : cases) {
        EXPECT_EQ(LinuxHostConfig::parseFlags(text), expected) << '"' << text << '"';
    }

    auto& config = root_.context().instance<HostConfig>();
    EXPECT_FALSE(config.multiUserFlags());
    root_.writeFile("/etc/quarnd/host-multiuser-flags", "3\n");
    EXPECT_EQ(config.multiUserFlags(), 3u);
    std::filesystem::remove(root_ / "/etc/quarnd/host-multiuser-flags");
    std::filesystem::create_directory(root_ / "/etc/quarnd/host-multiuser-flags");
    EXPECT_FALSE(config.multiUserFlags());
}

TEST(OsReleaseParsing, ShellQuotingAndLayoutNoiseAreUnderstoodAndMalformedLinesSkipped) {
    // Lines of one file, the key each names and its value (none: skipped);
    // one row per way of reading a line.
    const struct {
        const char* lines;
        const char* key;
        std::optional<std::string> value;
    } cases[] = {
        {"KEY_2=plain=x", "KEY_2", "plain=x"},
        {"C='single \"quoted\" \\n kept'", "C", "single \"quoted\" \\n kept"},
        {"D=\"esc \\\" \\\\ \\$ \\` and \\n kept\"", "D", "esc \" \\ $ ` and \\n kept"},
        {"E=bare\\ escaped\\\\", "E", "bare escaped\\"},
        {"G=", "G", ""},
        {"I=trailing\\", "I", "trailing"},
        {"J=\"ends in escaped quote\\\"\"", "J", "ends in escaped quote\""},
        {"# comment=ignored\n\n   \t", "# comment", {}},
        {"  SPACED  =  \"value\"  \r", "SPACED", "value"},
        {"X=first\nX=second", "X", "second"},
        {"no equals sign\n=novalue", "", {}},
        {"1KEY=digit first", "1KEY", {}},
        {"BAD-KEY=dash", "BAD-KEY", {}},
        {"OPEN=\"never closed", "OPEN", {}},
        {"AFTER=\"x\"'joined'", "AFTER", {}},
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

TEST_F(RootFilesTest, OsVariantFollowsOsReleaseFallsBackToTheVendorFileAndIgnoresNonFiles) {
    auto& variant = root_.context().instance<OsVariant>();
    const auto internal = [&] { return variant.hasInternalContent("com.orvex.quarnd"); };
    EXPECT_EQ(variant.versionDictionary(), Value::dictionary()); // no file

    root_.writeFile("/etc/os-release", "NAME=\"Orvex OS\"\nVERSION_ID=\"4.2\"\n"
                                       "BUILD_ID='21A5248v'\nVARIANT_ID=internal\n");
    EXPECT_TRUE(internal());
    EXPECT_EQ(variant.versionDictionary(),
              Value(Value::Dictionary{
                  {"BuildID", "21A5248v"}, {"VersionID", "4.2"}, {"VariantID", "internal"}}));
    EXPECT_EQ(variant.buildVersion(), "21A5248v");
    // Changes are seen without a restart of the daemon's platform.
    for (const char* other : {"VARIANT_ID=\"internal-debug\"\n", "VARIANT_ID=Internal\n"}) {
        root_.writeFile("/etc/os-release", other);
        EXPECT_FALSE(internal()) << other;
        EXPECT_EQ(variant.versionDictionary().get("BuildID"), nullptr);
    }

    std::filesystem::remove(root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=vendor\nVARIANT_ID=internal\n");
    EXPECT_EQ(variant.buildVersion(), "vendor");
    std::filesystem::create_symlink("../usr/lib/os-release", root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=linked\n");
    EXPECT_EQ(variant.buildVersion(), "linked");
    // Something other than a file counts as no answer, without falling back.
    std::filesystem::remove(root_ / "/etc/os-release");
    std::filesystem::create_directories(root_ / "/etc/os-release");
    root_.writeFile("/usr/lib/os-release", "BUILD_ID=vendor\nVARIANT_ID=internal\n");
    EXPECT_FALSE(internal());
    EXPECT_FALSE(variant.buildVersion());
}

TEST(FirstBootMarkerTest, MarkersOfTwoRootsAreIndependent) {
    quarn::test::TempRoot rootA, rootB(quarn::test::TempRoot::Options{true, false});
    const FirstBootMarker a(rootA.path()), b(rootB.path());
    EXPECT_TRUE(std::regex_match(a.name(), std::regex("/quarnd\\.fb_check\\.[0-9a-f]{8}")));
    // The same root, spelt with a trailing slash, is the same marker.
    EXPECT_EQ(FirstBootMarker(rootA.path().string() + "/").name(), a.name());
    EXPECT_EQ(FirstBootMarker("/").name(), "/quarnd.fb_check");

    // Creating an existing marker and removing an absent one are no errors.
    ASSERT_TRUE(a.remove() && b.remove() && a.create() && a.create());
    EXPECT_EQ(std::make_pair(a.exists(), b.exists()), std::make_pair(true, false));
    ASSERT_TRUE(b.create() && a.remove() && a.remove());
    EXPECT_EQ(std::make_pair(a.exists(), b.exists()), std::make_pair(false, true));
    ASSERT_TRUE(b.remove());
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

// The accounts are read again on each question.
TEST_F(RootFilesTest, AccountsAreTheRootsOwnWithHomesBelowItMalformedLinesSkipped) {
    auto& installed = root_.context().instance<Accounts>();
    EXPECT_EQ(installed.userByName("mobile")->homeDirectory, root_.path() / "private/var/mobile");
    // uid 0 of the temp root, not of the host.
    EXPECT_EQ(installed.userByUID(0)->homeDirectory, root_.path() / "private/var/root");
    EXPECT_EQ(installed.groupByName("systemusers")->members, std::vector<std::string>{"mobile"});
    EXPECT_EQ(installed.groupByGID(quarn::test::kSystemUsersGID)->name, "systemusers");
    EXPECT_FALSE(installed.userByUID(4242));
    EXPECT_FALSE(installed.groupByGID(7777));
    EXPECT_TRUE(installed.groupByGID(0)->members.empty());
    for (std::string_view name : std::initializer_list<std::string_view>{
             "nobody-here", "", "mobil", std::string_view("mobile\0x", 8)}) {
        EXPECT_FALSE(installed.userByName(name)) << name;
        EXPECT_FALSE(installed.groupByName(name)) << name;
    }

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
    LinuxAccounts a{Paths(root_.path())};
    EXPECT_EQ(a.userByUID(501)->name, "mobile"); // the first entry of a uid wins
    EXPECT_EQ(a.userByName("twin")->gid, 20u);
    for (const char* name : {"nouid", "alpha", "huge", "short", "+compat", "compat", "garbage"}) {
        EXPECT_FALSE(a.userByName(name)) << name;
    }
    for (uid_t uid : {9, 10, 12}) { // nameless, compat marker, bad uid
        EXPECT_FALSE(a.userByUID(uid)) << uid;
    }
    EXPECT_EQ(a.groupByGID(1501)->members, (std::vector<std::string>{"mobile", "other"}));
    EXPECT_FALSE(a.groupByName("nogid"));
    // Homes that leave the root or are missing are empty.
    for (const char* name : {"escape", "nohome", "emptyhome"}) {
        EXPECT_TRUE(a.userByName(name) && a.userByName(name)->homeDirectory.empty()) << name;
    }
    EXPECT_EQ(a.userByName("relative")->homeDirectory, root_.path() / "var/rel");

    // Entries longer than the first buffer are read whole.
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
    EXPECT_EQ(a.groupByName("crowd")->members, many);
    EXPECT_EQ(a.groupByGID(12)->name, "after"); // the reader did not lose its place
    EXPECT_EQ(a.userByUID(700)->homeDirectory, root_ / longHome);
    EXPECT_EQ(a.userByName("next")->uid, 701u);

    // Missing or unreadable files answer nothing.
    std::filesystem::remove(root_ / "/etc/group");
    std::filesystem::remove(root_ / "/etc/passwd");
    std::filesystem::create_directory(root_ / "/etc/passwd");
    EXPECT_FALSE(a.userByName("long") || a.userByUID(700) || a.groupByName("crowd") ||
                 a.groupByGID(11));
}

TEST(AccountsOnSystemRoot, AsksTheNameServiceAndLeavesHomesAlone) {
    LinuxAccounts a{Paths("/")};
    const auto root = a.userByUID(0);
    const auto wheel = a.groupByGID(0);
    ASSERT_TRUE(root && wheel);
    EXPECT_EQ(std::tie(root->name, root->gid), std::make_tuple("root", 0u));
    EXPECT_EQ(root->homeDirectory.string().substr(0, 1), "/");
    EXPECT_EQ(std::make_pair(a.userByName("root")->uid, a.groupByName(wheel->name)->gid),
              std::make_pair(0u, 0u));
    EXPECT_FALSE(a.userByName("no-such-user-quarn") || a.groupByName("no-such-group-quarn"));
}

TEST_F(RootFilesTest, LockStateFollowsTheFileHoldingOneDecimalState) {
    const std::pair<const char*, std::optional<std::int32_t>> cases[] = {
        {"0", 0},   {"1\n", 1}, {"  3 \r\n", 3}, {"-2", -2},  {"", {}},    {"\n", {}},
        {"1x", {}}, {"+1", {}}, {"locked", {}},  {"0x1", {}}, {"1 0", {}}, {"2147483648", {}},
    };
    for (const auto& [text, expected] : cases) {
        EXPECT_EQ(LinuxLockState::parseState(text), expected) << '"' << text << '"';
    }
    auto& lock = root_.context().instance<LockState>();
    EXPECT_EQ(lock.state(), LockState::kUnlocked); // no file, no run directory
    for (const auto& [text, state] : {std::pair<const char*, std::int32_t>{"2\n", 2},
                                      {"garbage", LinuxLockState::kUnreadable}}) {
        root_.writeFile(kLockFile, text);
        EXPECT_EQ(lock.state(), state) << text;
    }
    // A link planted in place of the file is not believed.
    std::filesystem::remove(root_ / kLockFile);
    root_.writeFile("/elsewhere", "1");
    std::filesystem::create_symlink(root_ / "/elsewhere", root_ / kLockFile);
    EXPECT_EQ(lock.state(), LinuxLockState::kUnreadable);
}

TEST_F(RootFilesTest, LockStateWatchSeesChangesAndStopsCleanly) {
    const auto file = root_ / kLockFile;
    const auto byRename = [&](const char* text) {
        root_.writeFile(kLockFile + ".new", text);
        std::filesystem::rename(root_ / (kLockFile + ".new"), file);
    };
    LinuxLockState lockState{Paths(root_.path())};
    Reports first, second, third;
    V expected;
    const auto step = [&](const std::function<void()>& change, std::int32_t state) {
        change();
        expected.push_back(state);
        EXPECT_EQ(first.waitFor(expected.size()), expected);
    };
    const auto write = [&](const char* text) { root_.writeFile(kLockFile, text); };
    ASSERT_TRUE(lockState.startWatching(std::ref(first))); // makes the run directory
    step([&] { write("1"); }, 1);
    write("1"); // no change: not reported
    root_.writeFile("/private/var/run/quarnd/unrelated", "0");
    step([&] { byRename("0"); }, 0);
    step([&] { byRename("2"); }, 2);
    step([&] { write("1"); }, 1);
    step([&] { std::filesystem::remove(file); }, 0);
    step([&] { write("1"); }, 1);
    step([&] { std::filesystem::rename(file, file.parent_path() / "moved-away"); }, 0);
    step([&] { write("1"); }, 1);

    // A new watch replaces the old and does not report the state at its start (1).
    ASSERT_TRUE(lockState.startWatching(std::ref(second)));
    write("0");
    EXPECT_EQ(second.waitFor(1), V{0});
    lockState.stopWatching();
    lockState.stopWatching(); // twice is harmless
    ASSERT_TRUE(lockState.startWatching(std::ref(third)));
    write("1");
    EXPECT_EQ(third.waitFor(1), V{1});
    std::filesystem::remove_all(file.parent_path()); // a lost run directory is unlocked
    EXPECT_EQ(third.waitFor(2), (V{1, 0}));
    EXPECT_EQ(lockState.state(), LockState::kUnlocked);
    // The earlier watches were joined before their replacement started.
    EXPECT_EQ(first.waitFor(), expected);
    EXPECT_EQ(second.waitFor(), V{0});

    // A callback may stop its own watch; destruction joins.
    auto lock = std::make_unique<LinuxLockState>(Paths(root_.path()));
    Reports reports;
    ASSERT_TRUE(lock->startWatching([&](std::int32_t state) {
        lock->stopWatching(); // must neither deadlock nor crash
        reports(state);
    }));
    root_.writeFile(kLockFile, "1");
    EXPECT_EQ(reports.waitFor(1), V{1});
    ASSERT_TRUE(lock->startWatching(std::ref(reports)));
    lock.reset(); // with a live watch: the thread must be gone before the object
    root_.writeFile(kLockFile, "0");
    EXPECT_EQ(reports.waitFor(), V{1});
}

// Each post appends a line to a file named after the notification and,
// under a service manager, becomes the status line.
TEST_F(RootFilesTest, NotificationsArePostedAsLinesAndStatusAndBadNamesAndLinksRefused) {
    LinuxNotifications notifications{Paths(root_.path())};
    const auto fileFor = [&](std::string_view name) { return notifications.directory() / name; };
    const auto name = Notifications::kUserInvalidated;
    ASSERT_FALSE(std::filesystem::exists(Paths(root_.path()).runDirectory()));
    ASSERT_TRUE(notifications.post(name));
    ASSERT_TRUE(notifications.post(name));
    // The platform installs this poster.
    ASSERT_TRUE(root_.context().instance<Notifications>().post(Notifications::kCleanupComplete));

    EXPECT_EQ(notifications.directory(), root_ / "/private/var/run/quarnd/notifications");
    const std::string lines = contentsOf(fileFor(name));
    EXPECT_TRUE(std::regex_match(
        lines,
        std::regex(
            R"((\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z com\.orvex\.quarnd\.user-invalidated\n){2})")))
        << lines;
    EXPECT_EQ(std::ranges::count(contentsOf(fileFor(Notifications::kCleanupComplete)), '\n'), 1);

    // Stands in for the service manager: a datagram socket named by NOTIFY_SOCKET.
    const auto path = root_.path() / "notify";
    const Descriptor fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_un addr{.sun_family = AF_UNIX, .sun_path = {}};
    std::strcpy(addr.sun_path, path.c_str());
    ASSERT_EQ(::bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
    auto received = [&] {
        char buffer[512];
        const ssize_t n = ::recv(fd.get(), buffer, sizeof buffer, MSG_DONTWAIT);
        return n > 0 ? std::string(buffer, static_cast<std::size_t>(n)) : std::string();
    };

    const bool posted = bool(notifications.post(Notifications::kUserInvalidated));
    const std::string status = received();
    const bool refused = !notifications.post("a/b"); // and tells the manager nothing
    const std::string afterRefused = received();
    ::unsetenv("NOTIFY_SOCKET");
    EXPECT_TRUE(posted && refused);
    EXPECT_EQ(status, "STATUS=Posted com.orvex.quarnd.user-invalidated");
    EXPECT_EQ(afterRefused, "");

    // Names that are no file names, and planted links.
    for (std::string_view bad : {"", ".hidden", "..", "../../etc/passwd", "new\nline"}) {
        auto posted = notifications.post(bad);
        ASSERT_FALSE(posted) << bad;
        EXPECT_TRUE(posted.error().isPOSIX(EINVAL)) << bad;
    }
    EXPECT_FALSE(notifications.post(std::string(Notifications::kMaxNameLength + 1, 'a')));

    // The directory is a link.
    const auto elsewhere = root_ / "/elsewhere";
    std::filesystem::create_directories(elsewhere);
    std::filesystem::remove_all(notifications.directory());
    std::filesystem::create_directory_symlink(elsewhere, notifications.directory());
    EXPECT_FALSE(notifications.post(Notifications::kCleanupComplete));
    EXPECT_TRUE(std::filesystem::is_empty(elsewhere));
    // The file is a link to a file the daemon must not append to.
    std::filesystem::remove(notifications.directory());
    std::filesystem::create_directories(notifications.directory());
    root_.writeFile("/elsewhere/victim", "untouched\n");
    std::filesystem::create_symlink(elsewhere / "victim", fileFor(Notifications::kCleanupComplete));
    auto throughLink = notifications.post(Notifications::kCleanupComplete);
    ASSERT_FALSE(throughLink);
    EXPECT_TRUE(throughLink.error().isPOSIX(ELOOP));
    EXPECT_EQ(contentsOf(elsewhere / "victim"), "untouched\n");
}
