#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/Paths.h"

#include "FsTestSupport.h"
#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace quarn::test {
namespace {

namespace fs = std::filesystem;

class ProtectionTest : public TempRootTest {
protected:
    void SetUp() override {
        fs::create_directories(dir());
        writeFile(file(), "data");
    }

    QRNFileManager& manager() { return QRNFileManager::defaultManager(); }
    fs::path dir() { return root_ / "/private/var/containers/Data/A"; }
    fs::path file() { return dir() / "file"; }
    int classOf(const fs::path& p) { return *manager().dataProtectionClassOfItemAtURL(p); }
    void setLockState(const char* state) {
        auto run = Paths(root_.path()).runDirectory();
        fs::create_directories(run);
        writeFile(run / "lockstate", state);
    }
};

TEST_F(ProtectionTest, ClassesRoundTripOnFilesAndDirectories) {
    EXPECT_EQ(classOf(file()), 0) << "no class set";
    for (auto item : {file(), dir()}) {
        ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(item, 3));
        EXPECT_EQ(classOf(item), 3);
        EXPECT_EQ(xattrOf(item, kProtectionClassAttribute), "3");
    }
}

TEST_F(ProtectionTest, PredicateSeesTheCurrentClassAndCanDecline) {
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(file(), 2));
    int seen = -1;
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(file(), 4, [&](int current) {
        seen = current;
        return false;
    }));
    EXPECT_EQ(seen, 2);
    EXPECT_EQ(classOf(file()), 2) << "declined: nothing changed";

    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(
        file(), 4, [](int current) { return current < 4; }));
    EXPECT_EQ(classOf(file()), 4);
}

TEST_F(ProtectionTest, ItemsThatCannotHoldAClassAnswerEBADF) {
    fs::create_symlink(file(), dir() / "link");
    ::mkfifo((dir() / "fifo").c_str(), 0600);
    int sock = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const auto socketPath = (dir() / "sock").string();
    ASSERT_LT(socketPath.size(), sizeof address.sun_path);
    socketPath.copy(address.sun_path, socketPath.size());
    ASSERT_EQ(::bind(sock, reinterpret_cast<sockaddr*>(&address), sizeof address), 0);

    LogCapture log;
    for (auto item : {dir() / "link", dir() / "fifo", dir() / "sock"}) {
        auto get = manager().dataProtectionClassOfItemAtURL(item);
        ASSERT_FALSE(get) << item;
        EXPECT_TRUE(get.error().isPOSIX(EBADF)) << item;
        auto set = manager().setDataProtectionClassOfItemAtURL(item, 2);
        ASSERT_FALSE(set) << item;
        EXPECT_TRUE(set.error().isPOSIX(EBADF)) << item;
    }
    ::close(sock);
    EXPECT_TRUE(log.contains("Failed to getclass of file " + (dir() / "link").string()));
    EXPECT_TRUE(log.contains("Failed to setclass(2) on file " + (dir() / "fifo").string()));
    EXPECT_EQ(classOf(file()), 0) << "the link's target was not touched";

    auto missing = manager().setDataProtectionClassOfItemAtURL(dir() / "missing", 2);
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_TRUE(log.contains("Failed to open " + (dir() / "missing").string() + " : "));
}

TEST_F(ProtectionTest, ClassOneItemsCannotChangeWhileLocked) {
    auto other = dir() / "other";
    writeFile(other, "x");
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(file(), 1));
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(other, 2));

    setLockState("1");
    auto changed = manager().setDataProtectionClassOfItemAtURL(file(), 3);
    ASSERT_FALSE(changed);
    EXPECT_TRUE(changed.error().isPOSIX(EPERM));
    EXPECT_EQ(classOf(file()), 1);
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(file(), 1)) << "not a change";
    EXPECT_TRUE(manager().setDataProtectionClassOfItemAtURL(other, 3)) << "other classes can";
    EXPECT_EQ(classOf(other), 3);

    setLockState("0");
    ASSERT_TRUE(manager().setDataProtectionClassOfItemAtURL(file(), 3));
    EXPECT_EQ(classOf(file()), 3);
}

} // namespace
} // namespace quarn::test
