// Walks over trees users shape at will: far deeper than any descriptor
// limit, and changed under the walk.

#include "FsTestSupport.h"

#include "Daemon/fs/TreeRemover.h"
#include "Daemon/fs/TreeWalker.h"

#include <cstdio>
#include <cstdlib>

namespace quarn::test {
namespace {

long openDescriptors() {
    long n = 0;
    for ([[maybe_unused]] const auto& entry : fs::directory_iterator("/proc/self/fd"))
        ++n;
    return n;
}

class DeepTreeTest : public FsTest {
protected:
    fs::path dir() const { return root_.path(); }
};

// Where a hundred thousand directories are quick to make: a tmpfs when there
// is one (on a journaled disk the mkdirs alone take most of a minute).
class DeepScratch {
public:
    DeepScratch() {
        std::string pattern =
            (fs::exists("/dev/shm") ? "/dev/shm" : "/tmp") + std::string("/quarn-deep-XXXXXX");
        path_ = ::mkdtemp(pattern.data()) ? fs::path(pattern) : fs::path();
    }
    ~DeepScratch() {
        std::error_code ignored;
        fs::remove(path_ / "deep", ignored);
        fs::remove(path_, ignored);
    }
    const fs::path& path() const { return path_; }

private:
    fs::path path_;
};

TEST_F(DeepTreeTest, AHundredThousandLevelsAreWalkedMeasuredAndRemovedWithFewDescriptors) {
    constexpr int kDepth = 100000;
    const DeepScratch scratch;
    ASSERT_FALSE(scratch.path().empty());
    const fs::path top = scratch.path() / "deep";
    makeDeepTree(top, kDepth, 1);
    const long before = openDescriptors();

    // Every level counts at least what the top does (nothing on a tmpfs), and
    // the walk reached the bottom: every directory and the file were counted.
    const std::int64_t perLevel = lstatOf(top).st_blocks * 512;
    EXPECT_GE(manager_.diskUsageForURL(top), perLevel * kDepth);
    EXPECT_TRUE(log_.contains(fmt::format("descendants: {},", kDepth + 1))) << log_.all();

    long atBottom = -1;
    env_->setHook([&](EnvCall call, std::uint64_t) {
        if (call == EnvCall::Unlink && atBottom < 0)
            atBottom = openDescriptors(); // the first removal: the bottom file
    });
    ASSERT_TRUE(manager_.removeItemAtURL(top));
    env_->setHook(nullptr);
    EXPECT_FALSE(existsNoFollow(top));
    EXPECT_LE(atBottom - before, static_cast<long>(DirectoryStack::kDefaultOpenLevels) + 2);
    EXPECT_EQ(openDescriptors(), before);
}

// t/a/b/c/d/e/f with only two descriptors kept: climbing back from e has to
// open c, b and a again through "..". b is moved to other/ while the walk is
// at the bottom, so a's place is then taken by other/: the walk stops there.
TEST_F(DeepTreeTest, ADirectoryMovedAwayMidWalkStopsTheWalkBeforeItsNewParent) {
    const fs::path top = dir() / "t";
    const fs::path other = dir() / "other";
    auto moveAway = [&] {
        ASSERT_EQ(std::rename((top / "a/b").c_str(), (other / "b").c_str()), 0);
    };
    struct Case {
        const char* name;
        std::function<int()> run; // calls moveAway once at the bottom
    };
    const Case cases[] = {
        {"removal",
         [&] {
             bool moved = false;
             env_->setHook([&](EnvCall call, std::uint64_t) {
                 if (call == EnvCall::Unlink && !std::exchange(moved, true))
                     moveAway(); // before the first removal: the bottom file
             });
             EnvFd parent(*env_, *env_->openat(AT_FDCWD, dir().c_str(), O_PATH, 0));
             TreeRemover remover(*env_, 2);
             remover.removeTree(parent.get(), dir().string(), "t");
             env_->setHook(nullptr);
             return remover.firstError();
         }},
        {"traversal",
         [&] {
             TreeWalker walker(*env_, 2);
             auto failure = walker.walk(top, [&](const auto& entry) {
                 if (entry.name == "f")
                     moveAway();
                 return true;
             });
             return failure ? failure->err : 0;
         }},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        fs::create_directories(top / "a/b/c/d/e");
        writeFile(top / "a/b/c/d/e/f", "x");
        fs::create_directories(other);
        writeFile(other / "keep", "k");
        EXPECT_EQ(c.run(), ESTALE);
        EXPECT_TRUE(existsNoFollow(other / "keep"));
        EXPECT_TRUE(existsNoFollow(other / "b")) << "the moved directory stays in its new parent";
        EXPECT_TRUE(existsNoFollow(top / "a"));
        fs::remove_all(top);
        fs::remove_all(other);
    }
}

} // namespace
} // namespace quarn::test
