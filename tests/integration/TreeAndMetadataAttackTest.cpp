// The unprivileged user shapes its own trees against the daemon: metadata
// planted to claim another app's identifier, and trees far deeper than any
// descriptor limit in containers the daemon later measures and destroys.

#include "Attacker.h"
#include "Client/QRNClientRequests.h"
#include "Daemon/support/PropertyList.h"
#include "Daemon/support/UUID.h"
#include "DaemonHarness.h"

#include <fcntl.h>

namespace quarn::test {

namespace {

namespace fs = std::filesystem;
using Requests = QRNClientRequests;

constexpr const char* kMetadata = ".com.orvex.quarn_store.metadata.plist";

class TreeAndMetadataAttackTest : public AttackTest {
protected:
    // As the attacker: a chain of `depth` directories below `base`, made by
    // descriptor (its path is far longer than any the kernel takes).
    static bool buildDeepTree(const fs::path& base, int depth) {
        return asAttacker([&] {
            int fd = ::open(base.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
            for (int level = 0; fd >= 0 && level < depth; ++level) {
                const int next = ::mkdirat(fd, "d", 0755) == 0
                                     ? ::openat(fd, "d", O_RDONLY | O_DIRECTORY | O_CLOEXEC)
                                     : -1;
                ::close(fd);
                fd = next;
            }
            return fd >= 0 && ::close(fd) == 0;
        });
    }
};

TEST_F(TreeAndMetadataAttackTest, PlantedMetadataNeverTakesAnotherAppsContainer) {
    const fs::path real = create("com.orvex.test.victim", 2);
    ASSERT_FALSE(real.empty());
    const fs::path metadata = real / kMetadata;
    auto plist = QRN_dictionaryWithContentsOfURL(metadata);
    ASSERT_TRUE(plist);
    // Perfect copies but for their owner: the victim's identifier, each its
    // own directory's UUID, a file of the attacker's inside.
    std::vector<fs::path> planted;
    for (int i = 0; i < 5; ++i) {
        planted.push_back(real.parent_path() / UUID::random().string());
    }
    ASSERT_TRUE(asAttacker([&] {
        for (const fs::path& directory : planted) {
            Value forged = *plist;
            forged.set("QRNMetadataUUID", directory.filename().string());
            if (!fs::create_directories(directory / "Library") ||
                !QRN_writeToURL(forged, directory / kMetadata)) {
                return false;
            }
        }
        // And many links to one huge file, which would cost a parse each.
        Value huge = *plist;
        huge.set("QRNMetadataInfo", Value(Value::Dictionary{{"x", std::string(1 << 20, 'x')}}));
        const fs::path big = real.parent_path() / ".big";
        bool linked = QRN_writeToURL(huge, big).has_value();
        for (int i = 0; linked && i < 50; ++i) {
            const fs::path directory = real.parent_path() / UUID::random().string();
            linked = fs::create_directory(directory) &&
                     ::link(big.c_str(), (directory / kMetadata).c_str()) == 0;
        }
        return linked;
    }));
    daemon_.expectCleanStop();
    ASSERT_TRUE(daemon_.start());
    EXPECT_EQ(create("com.orvex.test.victim", 2), real);
    EXPECT_NE(daemon_.log().find("INCONSISTENT"), std::string::npos);
    EXPECT_NE(daemon_.log().find("Untrusted metadata file"), std::string::npos);
}

TEST_F(TreeAndMetadataAttackTest, DeepTreesAreMeasuredAndDestroyedWithoutHarm) {
    constexpr int kDepth = 10000; // far past the usual descriptor limit of 1024
    const fs::path transient = create("com.orvex.test.deep", 2, true);
    const fs::path permanent = create("com.orvex.test.deep", 2);
    ASSERT_FALSE(transient.empty() || permanent.empty());
    ASSERT_TRUE(buildDeepTree(transient / "tmp", kDepth));
    ASSERT_TRUE(buildDeepTree(permanent / "tmp", kDepth));

    const Value usage = daemon_.request(Requests::diskUsage({"com.orvex.test.deep", 2, {}}));
    const Value* bytes = usage.get("ReplyDiskUsage");
    ASSERT_TRUE(bytes && bytes->asUInt64()) << usage.description();
    // Every directory takes a block where directories take any room at all.
    struct stat top {};
    ASSERT_EQ(::lstat((permanent / "tmp").c_str(), &top), 0);
    EXPECT_GE(*bytes->asUInt64(), static_cast<std::uint64_t>(top.st_blocks) * 512 * kDepth);

    // A new transient container sends the old one, tree and all, to death row.
    const fs::path next = create("com.orvex.test.deep", 2, true);
    EXPECT_NE(next, transient);
    ASSERT_TRUE(daemon_.request(Requests::deleteContainersOnDeathRow()).isDictionary());
    EXPECT_TRUE(waitUntil([&] { return !fs::exists(transient); }));
    const fs::path dead = daemon_ / "/private/var/root/Library/Caches/com.orvex.quarnd/Dead";
    EXPECT_TRUE(waitUntil([&] { return fs::is_empty(dead); }));
    EXPECT_TRUE(daemon_.isRunning());
}

} // namespace

} // namespace quarn::test
