#include "Daemon/platform/CodeSigningRegistryLoader.h"
#include "Daemon/platform/EntitlementHolders.h"
#include "Daemon/platform/LinuxAccounts.h"
#include "Daemon/platform/LinuxCodeSigningRegistry.h"
#include "Daemon/platform/ProcessInfo.h"
#include "Daemon/support/Descriptor.h"
#include "Daemon/support/PropertyList.h"

#include "common/TempRoot.h"
#include "common/shared/ChildProcess.h"

#include <gtest/gtest.h>
#include <sodium.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <thread>
#include <vector>

using namespace quarn;

namespace {

std::string hexOf(const ExecutableDigestCache::Digest& digest) {
    char hex[2 * digest.size() + 1];
    sodium_bin2hex(hex, sizeof hex, digest.data(), digest.size());
    return hex;
}

std::string sha256Hex(const std::string& bytes) {
    ExecutableDigestCache::Digest digest;
    crypto_hash_sha256(digest.data(), reinterpret_cast<const unsigned char*>(bytes.data()),
                       bytes.size());
    return hexOf(digest);
}

Value entry(std::string program, std::string identifier) {
    return Value(
        Value::Dictionary{{"Program", std::move(program)}, {"Identifier", std::move(identifier)}});
}
Value with(Value plist, const char* key, Value value) {
    plist.set(key, std::move(value));
    return plist;
}

IpcPeer::AuditToken tokenOf(pid_t pid) {
    auto peer = IpcPeer::fromPID(pid);
    EXPECT_TRUE(peer);
    return peer ? peer->auditToken() : IpcPeer::AuditToken{};
}

class CodeSigningRegistryTest : public quarn::test::TempRootTest {
protected:
    const std::string self_ = std::filesystem::read_symlink("/proc/self/exe").string();
    Paths paths_{root_.path()};
    std::filesystem::path directory_ = paths_.configDirectory() / "codesign.d";
    LinuxCodeSigningRegistry registry_{paths_, std::make_shared<LinuxAccounts>(paths_)};

    void write(const std::string& name, const Value& plist) const {
        std::filesystem::create_directories(directory_);
        ASSERT_TRUE(QRN_writeToURL(plist, directory_ / name, {.atomic = true}));
    }
    // The identifier the registry gives the token, empty for none.
    std::string identifierOf(const IpcPeer::AuditToken& token = tokenOf(::getpid())) {
        const auto info = registry_.infoForAuditToken(token);
        return info ? info->identifier : std::string();
    }
};

// Whether the child `pid` runs `program`, by the kernel's account, within a
// few seconds, its execve complete (its environment in place).
bool runs(pid_t pid, const std::filesystem::path& program) {
    const auto proc = "/proc/" + std::to_string(pid);
    const auto settled = [&] {
        std::error_code error;
        std::ifstream environ(proc + "/environ");
        return std::filesystem::read_symlink(proc + "/exe", error) == program &&
               environ.peek() != std::char_traits<char>::eof();
    };
    for (int i = 0; i < 5000 && !settled(); ++i) {
        ::usleep(1000);
    }
    return settled();
}

} // namespace

// One entry for this test process, rewritten, removed and made again.
TEST_F(CodeSigningRegistryTest, FollowsTheEntriesOfTheRunningProcessAndChecksItsDigest) {
    EXPECT_EQ(identifierOf(), "") << "no directory yet";
    const Value plist =
        with(with(entry(self_, "com.orvex.tests"), "Sandboxed", true), "Entitlements",
             Value::Dictionary{{"com.orvex.private.Quarn.allowed", true}});
    write("self.plist", plist);
    auto info = registry_.infoForAuditToken(tokenOf(::getpid()));
    ASSERT_TRUE(info && info->entitlements);
    EXPECT_EQ(info->identifier, "com.orvex.tests");
    EXPECT_TRUE(info->sandboxed);
    EXPECT_EQ(*info->entitlements, *plist.get("Entitlements"));

    std::ifstream exe("/proc/self/exe", std::ios::binary);
    write("self.plist",
          with(plist, "SHA256", sha256Hex({std::istreambuf_iterator<char>(exe), {}})));
    EXPECT_EQ(identifierOf(), "com.orvex.tests");
    write("self.plist", with(plist, "SHA256", std::string(64, 'a')));
    EXPECT_EQ(identifierOf(), "");

    // Another process that got the pid, or none at all.
    write("self.plist", plist);
    IpcPeer::TokenFields fields = IpcPeer::fieldsOfAuditToken(tokenOf(::getpid()));
    fields.startTime += 1;
    EXPECT_EQ(identifierOf(IpcPeer::makeAuditToken(fields)), "");
    fields.pid = 0;
    EXPECT_EQ(identifierOf(IpcPeer::makeAuditToken(fields)), "");

    std::filesystem::remove(directory_ / "self.plist");
    EXPECT_EQ(identifierOf(), "");
    write("again.plist", entry(self_, "com.orvex.second"));
    EXPECT_EQ(identifierOf(), "com.orvex.second");

    // Lookups during rewrites see one of the versions.
    write("again.plist", entry(self_, "com.orvex.v0"));
    std::atomic<bool> done{false};
    std::atomic<int> wrong{0};
    std::vector<std::thread> readers;
    for (int i = 0; i < 4; ++i) {
        readers.emplace_back([&] {
            while (!done.load()) {
                wrong += identifierOf().rfind("com.orvex.v", 0) != 0;
            }
        });
    }
    for (int version = 1; version <= 50; ++version) {
        write("again.plist", entry(self_, "com.orvex.v" + std::to_string(version)));
    }
    done.store(true);
    for (auto& reader : readers) {
        reader.join();
    }
    EXPECT_EQ(wrong.load(), 0);
    EXPECT_EQ(identifierOf(), "com.orvex.v50");
}

TEST_F(CodeSigningRegistryTest, AFileBoundOverTheProgramInAnotherNamespaceIsNotTheProgram) {
    // Copies, so that each is a file of its own.
    const auto program = root_.path() / "registered", impostor = root_.path() / "impostor";
    std::filesystem::copy_file("/bin/sleep", program);
    std::filesystem::copy_file("/bin/sleep", impostor);
    write("registered.plist", entry(program.string(), "com.orvex.registered"));
    auto genuine = quarn::test::ChildProcess::spawn({program, {"60"}, {}, {}, {}});
    ASSERT_TRUE(genuine && runs(genuine->pid(), program));
    EXPECT_EQ(identifierOf(tokenOf(genuine->pid())), "com.orvex.registered");

    // The kernel names the registered path for the impostor, as an unprivileged
    // user in a user and mount namespace of its own could arrange.
    auto covered = quarn::test::ChildProcess::spawn(
        {"/usr/bin/unshare",
         {"--mount", "--propagation", "private", "/bin/sh", "-c",
          "mount --bind \"$0\" \"$1\" && exec \"$1\" 60", impostor.string(), program.string()},
         {},
         {},
         {}});
    if (!covered || !runs(covered->pid(), program)) {
        GTEST_SKIP() << "no mount namespace for the test";
    }
    EXPECT_EQ(identifierOf(tokenOf(covered->pid())), "");
}

TEST_F(CodeSigningRegistryTest, BadEntriesAreSkippedAndTheLaterFileWins) {
    const Value good = entry("/bin/good", "com.orvex.good");
    write("a-relative.plist", entry("bin/x", "com.orvex.x"));
    write("b-no-identifier.plist", entry("/bin/b", ""));
    write("c-short-digest.plist", with(entry("/bin/c", "c"), "SHA256", std::string(63, 'a')));
    write("d-bad-digest.plist", with(entry("/bin/d", "d"), "SHA256", std::string(64, 'g')));
    write("e-entitlements.plist", with(entry("/bin/e", "e"), "Entitlements", Value::array()));
    write("e-holders.plist", with(entry("/bin/holders", "holders"), "EntitledUsers", "root"));
    write("f-sandboxed.plist", with(entry("/bin/f", "f"), "Sandboxed", "true"));
    write("g-group-writable.plist", entry("/bin/g", "g"));
    ::chmod((directory_ / "g-group-writable.plist").c_str(), 0664);
    write("h-not-root.plist", entry("/bin/h", "h"));
    ASSERT_EQ(::chown((directory_ / "h-not-root.plist").c_str(), 501, 501), 0);
    std::ofstream(directory_ / "i-garbage.plist") << "<plist><dict><key>Program";
    write(".hidden.plist", entry("/bin/hidden", "hidden"));
    write("good.txt", entry("/bin/txt", "txt"));
    write("good-1.plist", with(good, "Identifier", "com.orvex.replaced"));
    write("good-2.plist", good);
    std::filesystem::create_symlink(directory_ / "good-2.plist", directory_ / "j-link.plist");

    const auto table = CodeSigningRegistryLoader::load(directory_, true);
    ASSERT_EQ(table.size(), 2u);
    EXPECT_EQ(table.at("/bin/good")->info.identifier, "com.orvex.good"); // the later file
    // Entitlements of the wrong type still name the program, with no rights.
    EXPECT_EQ(table.at("/bin/e")->info.entitlements, Value::dictionary());
    // Not as root, ownership and mode do not matter.
    EXPECT_EQ(CodeSigningRegistryLoader::load(directory_, false).size(), 4u);
}

TEST_F(CodeSigningRegistryTest, DigestCacheHashesARewrittenFileAgain) {
    const auto file = root_.path() / "program";
    std::ofstream(file, std::ios::binary) << "first version";
    ExecutableDigestCache cache;
    auto digestNow = [&] {
        Descriptor fd(::open(file.c_str(), O_RDONLY | O_CLOEXEC));
        auto digest = cache.digestOf(fd.get());
        return digest ? hexOf(*digest) : std::string();
    };
    EXPECT_EQ(digestNow(), sha256Hex("first version"));
    EXPECT_EQ(digestNow(), sha256Hex("first version"));

    // Same size, mtime put back: still seen as changed.
    struct stat before {};
    ASSERT_EQ(::stat(file.c_str(), &before), 0);
    std::ofstream(file, std::ios::binary | std::ios::trunc) << "other version";
    const timespec times[2] = {before.st_atim, before.st_mtim};
    ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), times, 0), 0);
    EXPECT_EQ(digestNow(), sha256Hex("other version"));
}

namespace {

// Accounts of a test: "mobile" 501/501, group "staff" 20.
class TestAccounts final : public Accounts {
public:
    std::optional<User> userByName(std::string_view name) const override {
        return name == "mobile" ? std::optional<User>(User{"mobile", 501, 501, {}}) : std::nullopt;
    }
    std::optional<User> userByUID(std::uint32_t uid) const override {
        return uid == 501 ? userByName("mobile") : std::nullopt;
    }
    std::optional<Group> groupByName(std::string_view name) const override {
        return name == "staff" ? std::optional<Group>(Group{"staff", 20, {}}) : std::nullopt;
    }
    std::optional<Group> groupByGID(std::uint32_t gid) const override {
        return gid == 20 ? groupByName("staff") : std::nullopt;
    }
};

ProcessInfo::Standing standing(std::uint32_t uid, std::uint32_t gid,
                               std::vector<std::uint32_t> groups = {}, pid_t tracer = 0) {
    return {uid, gid, std::move(groups), tracer};
}

} // namespace

TEST(EntitlementHolders, AdmitRootOnlyUnlessNamedAndNeverATracedOrPreloadedProcess) {
    const Value none = Value::dictionary();
    const Value users = Value(Value::Dictionary{{"EntitledUsers", Value::Array{"mobile", 0u}}});
    const Value groups = Value(Value::Dictionary{{"EntitledGroups", Value::Array{"staff"}}});
    const Value byNumber = Value(Value::Dictionary{{"EntitledUsers", Value::Array{502u}}});
    const struct {
        const char* what;
        const Value& keys;
        ProcessInfo::Standing standing;
        std::string injection;
        bool admitted;
    } rows[] = {
        {"root by default", none, standing(0, 0), "", true},
        {"a user by default", none, standing(501, 501), "", false},
        {"a root group is no root user", none, standing(501, 0, {0}), "", false},
        {"a named user", users, standing(501, 501), "", true},
        {"root when named", users, standing(0, 0), "", true},
        {"a user not named", users, standing(502, 502), "", false},
        {"a user by number", byNumber, standing(502, 502), "", true},
        {"named groups replace root", groups, standing(0, 0), "", false},
        {"a supplementary group", groups, standing(501, 501, {7, 20}), "", true},
        {"the effective group", groups, standing(501, 20), "", true},
        {"traced root", none, standing(0, 0, {}, 4242), "", false},
        {"preloaded root", none, standing(0, 0), "LD_PRELOAD", false},
        {"audited named user", users, standing(501, 501), "LD_AUDIT", false},
    };
    const TestAccounts accounts;
    for (const auto& row : rows) {
        std::string problem;
        const auto holders = EntitlementHolders::fromPropertyList(row.keys, problem);
        ASSERT_TRUE(holders) << row.what << ": " << problem;
        const auto refusal = holders->refusal({row.standing, row.injection}, accounts);
        EXPECT_EQ(!refusal, row.admitted) << row.what << ": " << refusal.value_or("");
    }
    for (const Value& bad : {Value(Value::Dictionary{{"EntitledUsers", "mobile"}}),
                             Value(Value::Dictionary{{"EntitledGroups", Value::Array{-1}}}),
                             Value(Value::Dictionary{{"EntitledUsers", Value::Array{""}}})}) {
        std::string problem;
        EXPECT_FALSE(EntitlementHolders::fromPropertyList(bad, problem)) << bad.description();
        EXPECT_NE(problem, "");
    }
}

TEST(ProcessInfoParsing, StandingAndLoaderInjection) {
    const auto parsed = ProcessInfo::parseStanding(
        "Name:\tx\nUid:\t0\t501\t0\t0\nGid:\t1\t20\t1\t1\nGroups:\t4 24 \nTracerPid:\t77\n");
    ASSERT_TRUE(parsed);
    EXPECT_EQ(parsed->effectiveUID, 501u);
    EXPECT_EQ(parsed->effectiveGID, 20u);
    EXPECT_EQ(parsed->groups, (std::vector<std::uint32_t>{4, 24}));
    EXPECT_EQ(parsed->tracer, 77);
    for (const char* bad : {"Uid:\t0\t0\t0\t0\nGid:\t0\t0\t0\t0\nGroups:\n",
                            "Uid:\t0\t0\t0\t0\nGid:\t0\t0\t0\t0\nTracerPid:\t0\n",
                            "Uid:\t0\t0\t0\t0\nGid:\t0\t0\t0\t0\nGroups:\tx\nTracerPid:\t0\n"}) {
        EXPECT_FALSE(ProcessInfo::parseStanding(bad)) << bad;
    }
    using namespace std::string_view_literals;
    const struct {
        std::string_view environ;
        const char* found;
    } rows[] = {
        {"HOME=/\0LD_PRELOAD=/tmp/x.so\0"sv, "LD_PRELOAD"},
        {"LD_AUDIT=a.so"sv, "LD_AUDIT"},
        {"A=1\0LD_LIBRARY_PATH=/tmp\0"sv, "LD_LIBRARY_PATH"},
        {"LD_PRELOAD=\0PATH=/bin\0"sv, ""}, // empty: nothing loaded
        {"XLD_PRELOAD=/tmp/x.so\0"sv, ""},
        {"A=LD_PRELOAD=/tmp/x.so\0"sv, ""},
        {""sv, ""},
    };
    for (const auto& row : rows) {
        EXPECT_EQ(ProcessInfo::findLoaderInjection(row.environ), row.found) << row.environ;
    }
}

// The registry withholds the entitlements of a registered program from a
// process that runs it with preloaded code or as a user the entry does not name.
TEST_F(CodeSigningRegistryTest, EntitlementsOnlyForAdmittedProcesses) {
    ::chmod(root_.path().c_str(), 0755);
    const auto program = root_.path() / "registered";
    std::filesystem::copy_file("/bin/sleep", program);
    const Value rights(Value::Dictionary{{"com.orvex.private.Quarn.allowed", true}});
    write("registered.plist",
          with(entry(program.string(), "com.orvex.registered"), "Entitlements", rights));
    // Runs the program (through setpriv when `asUser` is set) and answers
    // the entitlements the registry gives it.
    const auto entitlementsOf = [&](std::vector<std::string> environment,
                                    std::vector<std::string> asUser) {
        std::filesystem::path launcher = program;
        std::vector<std::string> arguments{"60"};
        if (!asUser.empty()) {
            launcher = "/usr/bin/setpriv";
            arguments = asUser;
            arguments.insert(arguments.end(), {program.string(), "60"});
        }
        auto child = quarn::test::ChildProcess::spawn(
            {launcher, std::move(arguments), std::move(environment), {}, {}});
        EXPECT_TRUE(child && runs(child->pid(), program));
        const auto info = child ? registry_.infoForAuditToken(tokenOf(child->pid())) : std::nullopt;
        EXPECT_TRUE(info && info->identifier == "com.orvex.registered");
        return info && info->entitlements ? *info->entitlements : Value();
    };
    EXPECT_EQ(entitlementsOf({}, {}), rights);
    EXPECT_EQ(entitlementsOf({"LD_PRELOAD=/nonexistent/quarn-test.so"}, {}), Value::dictionary());
    const std::vector<std::string> asMobile{"--reuid=501", "--regid=501", "--clear-groups"};
    EXPECT_EQ(entitlementsOf({}, asMobile), Value::dictionary());
    write("registered.plist",
          with(with(entry(program.string(), "com.orvex.registered"), "Entitlements", rights),
               "EntitledUsers", Value::Array{501u}));
    EXPECT_EQ(entitlementsOf({}, asMobile), rights);
}
