// The unprivileged user redirects directories of theirs through links; the
// daemon's clean-up passes, transient creates and metadata writes must then
// fail or leave everything outside the user's containers as it was.

#include "Attacker.h"
#include "Client/QRNClientRequests.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "DaemonHarness.h"

#include <fstream>

namespace quarn::test {

namespace {

namespace fs = std::filesystem;
using Requests = QRNClientRequests;

constexpr const char* kRefusal = "a symbolic link stands where the layout has a directory";

std::string contentsOf(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}

class PathAttackTest : public AttackTest {
protected:
    fs::path containers() const { return daemon_ / "/private/var/mobile/Containers"; }
    fs::path victim() const { return daemon_ / "/private/var/victim"; }

    // Root-owned files the attacker would like the daemon to destroy or change.
    void makeVictim(const std::vector<std::string>& directories) {
        for (const std::string& directory : directories) {
            fs::create_directories(victim() / directory);
            std::ofstream(victim() / directory / "precious") << "precious";
        }
    }

    // As the attacker: `name` in its Containers directory becomes a link to `target`.
    static bool linkAway(const fs::path& at, const fs::path& target) {
        return asAttacker([&] {
            fs::path aside = at;
            aside += ".real";
            return (::access(at.c_str(), F_OK) != 0 || ::rename(at.c_str(), aside.c_str()) == 0) &&
                   ::symlink(target.c_str(), at.c_str()) == 0;
        });
    }
};

TEST_F(PathAttackTest, BootCleanUpsDoNotFollowLinkedStagingTransientOrClassDirectories) {
    create("com.orvex.test.mine", 2); // the user's Containers and its directories
    daemon_.expectCleanStop();
    makeVictim({"Staging", "Temp", "Data/Application"});
    for (const char* name : {"Staging", "Temp", "Data"}) {
        ASSERT_TRUE(linkAway(containers() / name, victim() / name)) << name;
    }
    const TreeSnapshot before = snapshotOf(victim());
    // The next start is a first boot again: every clean-up pass runs.
    ASSERT_TRUE(FirstBootMarker(daemon_.root()).remove());
    ASSERT_TRUE(daemon_.start());
    const fs::path done = daemon_ / "/private/var/run/quarnd/notifications" /
                          "com.orvex.quarnd.reboot-cleanup-complete";
    ASSERT_TRUE(waitUntil([&] { return fs::exists(done); }));
    ASSERT_TRUE(daemon_.request(Requests::deleteContainersOnDeathRow()).isDictionary());

    EXPECT_EQ(snapshotOf(victim()), before);
    for (const char* directory : {"Staging", "Temp", "Data/Application"}) {
        EXPECT_EQ(contentsOf(victim() / directory / "precious"), "precious") << directory;
    }
    EXPECT_NE(daemon_.log().find(kRefusal), std::string::npos);
}

TEST_F(PathAttackTest, TransientCreatesThroughALinkedDirectoryFailAndGiveNothingAway) {
    const fs::path bundles = daemon_ / "/private/var/containers/Bundle";
    create("com.orvex.test.bundle", 1); // the installer's Bundle/Application
    create("com.orvex.test.mine", 2);
    const fs::path evil = containers() / "evil";
    ASSERT_TRUE(asAttacker([&] {
        return fs::create_directory(evil) &&
               ::symlink(bundles.c_str(), (evil / "Data").c_str()) == 0;
    }));
    // The transient directory, or the class directory inside it, leads to
    // the bundles.
    const std::pair<fs::path, fs::path> links[] = {{containers() / "Temp", evil},
                                                   {containers() / "Temp/Data", bundles}};
    for (const auto& [at, target] : links) {
        SCOPED_TRACE(at.string());
        ASSERT_TRUE(
            asAttacker([&] { return fs::create_directories(containers() / "Temp") || true; }));
        ASSERT_TRUE(linkAway(at, target));
        const TreeSnapshot before = snapshotOf(bundles);
        const Value reply =
            daemon_.request(Requests::createOrLookup("com.orvex.test.mine", 2, true, true));
        EXPECT_NE(replyError(reply), kQRNErrorNone) << reply.description();
        EXPECT_EQ(snapshotOf(bundles), before);
        EXPECT_EQ(::unlink(at.c_str()), 0);
    }
    EXPECT_NE(daemon_.log().find(kRefusal), std::string::npos);
}

TEST_F(PathAttackTest, MetadataWritesRefuseAContainerReplacedByALink) {
    const fs::path system = create("com.orvex.devicesettings", 12);
    const fs::path mine = create("com.orvex.test.mine", 2);
    ASSERT_FALSE(system.empty() || mine.empty());
    const std::string metadata = contentsOf(system / ".com.orvex.quarn_store.metadata.plist");
    ASSERT_TRUE(linkAway(mine, system));
    const TreeSnapshot before = snapshotOf(system);

    const Value reply = daemon_.request(
        Requests::setInfoValue({"com.orvex.test.mine", 2, std::nullopt}, "Color", "blue"));
    EXPECT_NE(replyError(reply), kQRNErrorNone) << reply.description();
    EXPECT_EQ(snapshotOf(system), before);
    EXPECT_EQ(contentsOf(system / ".com.orvex.quarn_store.metadata.plist"), metadata);
    EXPECT_NE(daemon_.log().find(kRefusal), std::string::npos);
}

} // namespace

} // namespace quarn::test
