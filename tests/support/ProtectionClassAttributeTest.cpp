#include "Daemon/support/ProtectionClassAttribute.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string>

using namespace quarn;
namespace fs = std::filesystem;

namespace {

class ProtectionClassAttributeTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string tmpl = (fs::temp_directory_path() / "quarn-pclass.XXXXXX").string();
        ASSERT_NE(mkdtemp(tmpl.data()), nullptr);
        dir_ = tmpl;
    }
    void TearDown() override {
        for (int fd : fds_) {
            close(fd);
        }
        fs::remove_all(dir_);
    }
    int open(const fs::path& p, int flags) {
        int fd = ::open(p.c_str(), flags | O_CLOEXEC);
        EXPECT_GE(fd, 0) << p << ": " << std::strerror(errno);
        fds_.push_back(fd);
        return fd;
    }
    int newFile(const char* name) { return open(dir_ / name, O_RDWR | O_CREAT | O_EXCL); }
    static int errorOf(const Expected<int, int>& r) { return r ? 0 : r.error(); }

    fs::path dir_;
    std::vector<int> fds_;
};

} // namespace

TEST_F(ProtectionClassAttributeTest, RoundTripsOnFilesAndDirectories) {
    ASSERT_EQ(geteuid(), 0u) << "these tests run as root";
    int file = newFile("f");
    fs::create_directory(dir_ / "d");
    int directory = open(dir_ / "d", O_RDONLY | O_DIRECTORY);
    for (int fd : {file, directory}) {
        EXPECT_EQ(ProtectionClassAttribute::getProtectionClass(fd).value_or(-1),
                  ProtectionClassAttribute::kNoClass);
        ASSERT_TRUE(ProtectionClassAttribute::setProtectionClass(fd, 3));
        EXPECT_EQ(ProtectionClassAttribute::getProtectionClass(fd).value_or(-1), 3);
        ASSERT_TRUE(ProtectionClassAttribute::setProtectionClass(fd, 14));
        EXPECT_EQ(ProtectionClassAttribute::getProtectionClass(fd).value_or(-1), 14);
    }
    // Other tools read the stored form: the decimal text under that name.
    char text[8] = {};
    ASSERT_EQ(getxattr((dir_ / "f").c_str(), "trusted.quarn.protection_class", text, sizeof text),
              2);
    EXPECT_STREQ(text, "14");
}

TEST_F(ProtectionClassAttributeTest, ItemsThatCannotHoldAClassReportBadDescriptor) {
    newFile("target");
    fs::create_symlink(dir_ / "target", dir_ / "link");
    int link = open(dir_ / "link", O_PATH | O_NOFOLLOW);
    ASSERT_EQ(mkfifo((dir_ / "fifo").c_str(), 0600), 0);
    int fifo = open(dir_ / "fifo", O_RDWR | O_NONBLOCK);
    int devnull = open("/dev/null", O_RDWR);
    for (int fd : {link, fifo, devnull}) {
        EXPECT_EQ(errorOf(ProtectionClassAttribute::getProtectionClass(fd)), EBADF);
        auto set = ProtectionClassAttribute::setProtectionClass(fd, 4);
        ASSERT_FALSE(set);
        EXPECT_EQ(set.error(), EBADF);
    }
    // The link's target was left alone.
    int target = open(dir_ / "target", O_RDONLY);
    EXPECT_EQ(ProtectionClassAttribute::getProtectionClass(target).value_or(-1), 0);
    EXPECT_EQ(errorOf(ProtectionClassAttribute::getProtectionClass(-1)), EBADF);
}

TEST_F(ProtectionClassAttributeTest, RejectsBadClassesAndCorruptValues) {
    int fd = newFile("f");
    auto negative = ProtectionClassAttribute::setProtectionClass(fd, -1);
    ASSERT_FALSE(negative);
    EXPECT_EQ(negative.error(), EINVAL);
    const char* name = ProtectionClassAttribute::attributeName();
    for (std::string stored : {"", "abc", "-1", "3x", " 3", "99999999999999999999999"}) {
        ASSERT_EQ(fsetxattr(fd, name, stored.data(), stored.size(), 0), 0);
        EXPECT_EQ(errorOf(ProtectionClassAttribute::getProtectionClass(fd)), EINVAL)
            << "stored \"" << stored << "\"";
    }
}

TEST_F(ProtectionClassAttributeTest, UnprivilegedProcessesUseTheUserNamespace) {
    ASSERT_EQ(seteuid(65534), 0);
    std::string name = ProtectionClassAttribute::attributeName();
    ASSERT_EQ(seteuid(0), 0);
    EXPECT_EQ(name, "user.quarn.protection_class");
}
