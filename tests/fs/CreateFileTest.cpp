#include "Daemon/fs/FaultInjectingEnv.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/fs/QRNFileManager.h"

#include "FsTestSupport.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <fcntl.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class CreateFileTest : public TempRootTest {
protected:
    void SetUp() override {
        fs::create_directories(dir_);
        auto opened = manager_.createAndOpenDirectoryAtURL(
            dir_, false, 0755, 0, QRNFileManager::kProtectionClassUnchanged);
        ASSERT_TRUE(opened);
        open_ = std::move(*opened);
    }
    Status create(const std::string& name, std::string_view text, int protectionClass) {
        auto bytes = std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
        return manager_.createFileInDirectory(open_, dir_, name, bytes, protectionClass);
    }

    std::shared_ptr<FaultInjectingEnv> env_ =
        std::make_shared<FaultInjectingEnv>(std::make_shared<LinuxEnv>());
    QRNFileManager manager_{root_.context(), env_};
    fs::path dir_ = root_ / "/private/var/files";
    EnvFd open_;
};

TEST_F(CreateFileTest, NewFileHoldsTheBytesAndTheClassAndNeverReplacesAnother) {
    ASSERT_TRUE(create("made", "contents", 4));
    EXPECT_EQ(readFile(dir_ / "made"), "contents");
    EXPECT_EQ(xattrOf(dir_ / "made", kProtectionClassAttribute), "4");
    EXPECT_EQ(lstatOf(dir_ / "made").st_mode & 07777, 0644u);

    auto again = create("made", "other", 4);
    ASSERT_FALSE(again);
    EXPECT_TRUE(again.error().isPOSIX(EEXIST));
    EXPECT_EQ(readFile(dir_ / "made"), "contents");

    // Not through a link either.
    fs::create_symlink(dir_ / "made", dir_ / "link");
    EXPECT_FALSE(create("link", "other", 4));
    EXPECT_EQ(readFile(dir_ / "made"), "contents");

    for (const char* name : {"", ".", "..", "a/b"}) {
        auto refused = create(name, "x", 4);
        ASSERT_FALSE(refused) << name;
        EXPECT_TRUE(refused.error().isPOSIX(EINVAL)) << name;
    }
}

TEST_F(CreateFileTest, FileThatCannotBeWrittenWholeIsRemoved) {
    for (EnvCall call : {EnvCall::Write, EnvCall::SetXattr, EnvCall::Close}) {
        SCOPED_TRACE(envCallName(call));
        env_->failCall(call, 1, ENOSPC);
        auto failed = create("partial", "contents", 4);
        ASSERT_FALSE(failed);
        EXPECT_TRUE(failed.error().isPOSIX(ENOSPC));
        EXPECT_EQ(failed.error().message,
                  "Failed to write " + (dir_ / "partial").string() + ": No space left on device");
        EXPECT_FALSE(existsNoFollow(dir_ / "partial"));
    }
}

} // namespace
} // namespace quarn::test
