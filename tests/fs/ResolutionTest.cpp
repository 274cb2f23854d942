// Paths below the root prefix are resolved by descriptor and never through a
// link a user planted; moves, listings, directory creation and temporary
// files keep to what was opened.
#include "FsTestSupport.h"

namespace quarn::test {
namespace {

class ResolutionTest : public FsTest {
protected:
    void SetUp() override {
        fs::create_directories(deep());
        writeFile(deep() / "item", "mine");
        // What a planted link would lead to: the same names, elsewhere.
        fs::create_directories(victim() / "Containers/Data/Application");
        writeFile(victim() / "Containers/Data/Application/item", "victim");
    }
    fs::path home() const { return root_ / "/private/var/mobile"; }
    fs::path deep() const { return home() / "Containers/Data/Application"; }
    fs::path victim() const { return root_ / "/private/var/victim"; }

    // Replaces the directory `level` (relative to the home) by a link to
    // the victim's directory of the same name.
    void plantLink(const std::string& level) {
        fs::rename(home() / level, home() / (level + ".real"));
        fs::create_directory_symlink(victim() / level, home() / level);
    }
};

TEST_F(ResolutionTest, ALinkAtAnyLevelFailsEveryOperationAndTouchesNothingBehindIt) {
    for (const std::string level :
         {"Containers", "Containers/Data", "Containers/Data/Application"}) {
        SCOPED_TRACE(level);
        SetUp();
        plantLink(level);
        const long before = countEntries(victim());

        EXPECT_EQ(manager_.resolver().open(deep(), O_PATH).error(), ELOOP);
        EXPECT_TRUE(failedWith(
            manager_.createDirectoryAtURL(deep() / "new", true, 0755, QRNFileManager::Owner{501}),
            ELOOP));
        EXPECT_TRUE(failedWith(manager_.listDirectoryAtURL(deep()), ELOOP));
        EXPECT_TRUE(failedWith(manager_.moveItemAtURL(deep() / "item", root_ / "/moved"), ELOOP));
        EXPECT_TRUE(failedWith(manager_.moveItemAtURL(root_ / "/private", deep() / "p"), ELOOP));
        EXPECT_TRUE(failedWith(manager_.openDirectoryAtURL(deep()), ELOOP));
        // Walks, removal and attribute changes start at the opened parent too.
        EXPECT_LT(manager_.diskUsageForURL(deep() / "item"), 0);
        EXPECT_TRUE(failedWith(manager_.removeItemAtURL(deep() / "item"), ELOOP));
        EXPECT_TRUE(
            failedWith(manager_.standardizeOwnershipAtURL(deep() / "item", 501, 501), ELOOP));
        EXPECT_FALSE(manager_.setDataProtectionClassOfItemAtURL(deep() / "item", 3));

        EXPECT_EQ(countEntries(victim()), before);
        EXPECT_EQ(readFile(victim() / "Containers/Data/Application/item"), "victim");
        EXPECT_TRUE(log_.contains("a symbolic link stands where the layout has a directory"));
        fs::remove(home() / level);
        fs::rename(home() / (level + ".real"), home() / level);
    }
}

TEST_F(ResolutionTest, ListedEntriesMoveFromTheListedDirectoryAfterASwap) {
    auto listing = manager_.listDirectoryAtURL(deep());
    ASSERT_TRUE(listing);
    ASSERT_EQ(listing->items.size(), 1u);
    plantLink("Containers/Data/Application");
    auto moved = manager_.moveItemInDirectoryToNewUniqueDirectory(
        listing->directory, listing->url, "item", root_ / "/private/var/root/Dead");
    ASSERT_TRUE(moved) << moved.error().description();
    EXPECT_EQ(readFile(*moved), "mine");
    EXPECT_EQ(readFile(victim() / "Containers/Data/Application/item"), "victim");
    EXPECT_FALSE(existsNoFollow(home() / "Containers/Data/Application.real/item"));
}

TEST_F(ResolutionTest, AnExistingDirectoryIsGivenAwayOnlyByRootOrItsIntendedOwner) {
    struct Case {
        uid_t existing;
        uid_t requested;
        bool allowed;
    };
    for (const Case c :
         {Case{33, 501, false}, Case{0, 501, true}, Case{501, 501, true}, Case{501, 33, false}}) {
        SCOPED_TRACE(testing::Message() << c.existing << " -> " << c.requested);
        const auto dir = deep() / "existing";
        fs::create_directory(dir);
        ASSERT_EQ(::chown(dir.c_str(), c.existing, c.existing), 0);
        auto made =
            manager_.createDirectoryAtURL(dir, true, 0755, QRNFileManager::Owner{c.requested});
        EXPECT_EQ(made.has_value(), c.allowed);
        EXPECT_EQ(lstatOf(dir).st_uid, c.allowed ? c.requested : c.existing);
        fs::remove(dir);
    }
}

TEST_F(ResolutionTest, TemporaryFilesAreNewFilesInADirectoryOnlyRootWrites) {
    const auto scratch = root_ / "/private/var/root/Scratch";
    struct Case {
        const char* existing; // "", "file", "link", "dir"
        mode_t dirMode;
        int err; // 0: made
    };
    for (const Case c : {Case{"", 0700, 0}, Case{"", 0755, 0}, Case{"file", 0700, EEXIST},
                         Case{"link", 0700, EEXIST}, Case{"dir", 0700, EEXIST},
                         Case{"", 0777, EPERM}, Case{"", 0720, EPERM}}) {
        SCOPED_TRACE(testing::Message() << c.existing << " " << std::oct << c.dirMode);
        fs::remove_all(scratch);
        fs::create_directories(scratch);
        ASSERT_EQ(::chmod(scratch.c_str(), c.dirMode), 0);
        const std::string kind = c.existing;
        if (kind == "file")
            writeFile(scratch / "t", "old");
        if (kind == "link")
            fs::create_symlink(victim() / "Containers/Data/Application/item", scratch / "t");
        if (kind == "dir")
            fs::create_directory(scratch / "t");
        auto dir = manager_.resolver().open(scratch, O_RDONLY | O_DIRECTORY);
        ASSERT_TRUE(dir);
        auto file = manager_.createTemporaryFileInDirectory(*dir, scratch, "t");
        if (c.err == 0)
            EXPECT_TRUE(file) << file.error().description();
        else
            EXPECT_TRUE(failedWith(file, c.err));
        EXPECT_EQ(readFile(victim() / "Containers/Data/Application/item"), "victim");
    }
}

TEST_F(ResolutionTest, RootOnlyDirectoriesAreRepairedAndNeverReachedThroughALink) {
    const auto dead = root_ / "/private/var/root/Dead";
    fs::create_directories(dead);
    ASSERT_EQ(::chown(dead.c_str(), 501, 501), 0);
    ASSERT_EQ(::chmod(dead.c_str(), 0777), 0);
    ASSERT_TRUE(manager_.openRootOnlyDirectoryAtURL(dead, 0700));
    EXPECT_EQ(describe(dead), "700 0:0 -");
    EXPECT_TRUE(log_.contains("Repairing " + dead.string()));

    fs::remove(dead);
    fs::create_directory_symlink(victim(), dead);
    EXPECT_TRUE(failedWith(manager_.openRootOnlyDirectoryAtURL(dead, 0700), ELOOP));
    EXPECT_TRUE(log_.contains("Refusing " + dead.string() + ": a symbolic link"));
    EXPECT_EQ(describe(victim()).substr(0, 3), "755");
}

TEST_F(ResolutionTest, AReplacedFileAppearsWholeOrTheOldOneStays) {
    const auto scratch = root_ / "/private/var/root/Scratch";
    auto dir = manager_.openDirectoryAtURL(deep());
    ASSERT_TRUE(dir);
    const std::string bytes = "new contents";
    const std::span<const std::uint8_t> data(reinterpret_cast<const std::uint8_t*>(bytes.data()),
                                             bytes.size());
    const std::string temporary = "temp_item";
    const QRNFileManager::FileReplacement replacement{scratch, temporary, 4};
    // A leftover of a crash is no obstacle.
    fs::create_directories(scratch);
    writeFile(scratch / temporary, "stale");
    ASSERT_TRUE(manager_.replaceFileInDirectory(*dir, deep(), "item", data, replacement));
    EXPECT_EQ(readFile(deep() / "item"), bytes);
    EXPECT_EQ(xattrOf(deep() / "item"), "4");
    EXPECT_EQ(describe(scratch).substr(0, 8), "700 0:0 ");

    for (EnvCall call : {EnvCall::Write, EnvCall::SetXattr, EnvCall::Rename}) {
        SCOPED_TRACE(envCallName(call));
        writeFile(deep() / "item", "old");
        env_->failCall(call, 1, EIO);
        EXPECT_TRUE(failedWith(
            manager_.replaceFileInDirectory(*dir, deep(), "item", data, replacement), EIO));
        EXPECT_EQ(readFile(deep() / "item"), "old");
        EXPECT_FALSE(existsNoFollow(scratch / temporary));
    }
}

} // namespace
} // namespace quarn::test
