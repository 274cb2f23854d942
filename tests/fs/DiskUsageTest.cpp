#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <unistd.h>

#include <string>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class DiskUsageTest : public TempRootTest {
protected:
    void SetUp() override {
        fs::create_directories(tree() / "a" / "b");
        writeFile(tree() / "small", "x");
        writeFile(tree() / "a" / "big", std::string(256 * 1024, 'b'));
        writeFile(tree() / "a" / "b" / "medium", std::string(40 * 1024, 'm'));
        writeFile(root_ / "/outside", std::string(512 * 1024, 'o'));
    }

    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
    fs::path tree() { return root_ / "/private/var/containers/Data/A"; }
    // The allocated size of the items the test made, counted by hand.
    std::int64_t allocated(std::initializer_list<fs::path> items) {
        std::int64_t total = 0;
        for (const auto& item : items) {
            total += static_cast<std::int64_t>(lstatOf(item).st_blocks) * 512;
        }
        return total;
    }
    std::int64_t madeTree() {
        return allocated({tree(), tree() / "a", tree() / "a" / "b", tree() / "small",
                          tree() / "a" / "big", tree() / "a" / "b" / "medium"});
    }
    void switchFastSizing(bool on) {
        root_.writeFile("/etc/quarnd/features/quarnd.plist",
                        std::string("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
                                    "<plist version=\"1.0\"><dict>"
                                    "<key>fast_container_sizing</key><dict><key>Enabled</key>") +
                            (on ? "<true/>" : "<false/>") + "</dict></dict></plist>\n");
    }
};

TEST_F(DiskUsageTest, AllocatedSizesOfAKnownTree) {
    const auto expected = madeTree();
    ASSERT_GE(expected, 296 * 1024) << "the data itself is allocated";
    EXPECT_EQ(manager().diskUsageForURL(tree()), expected);

    // A hard link is counted once; a link's target outside is not counted.
    fs::create_hard_link(tree() / "a" / "big", tree() / "again");
    fs::create_symlink(root_ / "/outside", tree() / "link");
    EXPECT_EQ(manager().diskUsageForURL(tree()), expected + allocated({tree() / "link"}));

    // A sparse file counts what it occupies, not its length.
    int fd = ::open((tree() / "sparse").c_str(), O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::ftruncate(fd, 1 << 30), 0);
    ::close(fd);
    EXPECT_LT(manager().diskUsageForURL(tree()), expected + (1 << 20));

    EXPECT_EQ(manager().diskUsageForURL(tree() / "small"), allocated({tree() / "small"}));
}

TEST_F(DiskUsageTest, FailuresAreNegative) {
    LogCapture log;
    EXPECT_LT(manager().diskUsageForURL(tree() / "missing"), 0);
    EXPECT_TRUE(log.contains("Failed to get dirstats on " + (tree() / "missing").string() +
                             " using fallback: (err 2)"))
        << log.all();
    EXPECT_LT(manager().diskUsageForURL(fs::path()), 0);
    EXPECT_LT(manager().fastDiskUsageForURL(fs::path()), 0);
    EXPECT_TRUE(log.contains("Failed to get path to url"));
}

TEST_F(DiskUsageTest, FastSizingTriesDirectoryStatisticsThenWalks) {
    LogCapture log;
    switchFastSizing(false);
    EXPECT_EQ(manager().fastDiskUsageForURL(tree()), madeTree());
    EXPECT_FALSE(log.contains("dirstats on " + tree().string() + ":")) << "switch off: walk only";

    switchFastSizing(true);
    EXPECT_EQ(manager().fastDiskUsageForURL(tree()), madeTree());
    EXPECT_TRUE(log.contains("Failed to set maintain-dir-stats on " + tree().string()));
    EXPECT_TRUE(log.contains("Failed to get dirstats on " + tree().string() + ": (err " +
                             std::to_string(ENOTSUP) + ")"));
    EXPECT_TRUE(log.contains("descendants: 5, total size: " + std::to_string(madeTree()) +
                             ", using fallback"))
        << log.all();
    EXPECT_LT(manager().fastDiskUsageForURL(tree() / "missing"), 0);
}

} // namespace
} // namespace quarn::test
