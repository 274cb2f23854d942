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
using P = ProtectionClassAttribute;

namespace {

class ProtectionClassAttributeTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::string tmpl = (fs::temp_directory_path() / "quarn-pclass.XXXXXX").string();
        ASSERT_NE(mkdtemp(tmpl.data()), nullptr);
        dir_ = tmpl;
    }
    void TearDown() override {
        for (int fd : fds_)
            close(fd);
        fs::remove_all(dir_);
    }
    int open(const fs::path& p, int flags = O_RDWR | O_CREAT) {
        int fd = ::open(p.c_str(), flags | O_CLOEXEC, 0600);
        EXPECT_GE(fd, 0) << p << ": " << std::strerror(errno);
        fds_.push_back(fd);
        return fd;
    }
    // The class, or minus the error.
    static int classOf(int fd) {
        auto r = P::getProtectionClass(fd);
        return r ? *r : -r.error();
    }

    fs::path dir_;
    std::vector<int> fds_;
};

} // namespace

TEST_F(ProtectionClassAttributeTest, RoundTripsOnFilesAndDirectoriesInTheRightNamespace) {
    ASSERT_EQ(geteuid(), 0u) << "these tests run as root";
    fs::create_directory(dir_ / "d");
    for (int fd : {open(dir_ / "f"), open(dir_ / "d", O_RDONLY | O_DIRECTORY)}) {
        EXPECT_EQ(classOf(fd), P::kNoClass);
        for (int cls : {3, 14}) {
            ASSERT_TRUE(P::setProtectionClass(fd, cls));
            EXPECT_EQ(classOf(fd), cls);
        }
    }
    // Other tools read the stored form: the decimal text under that name.
    char text[8] = {};
    ASSERT_EQ(getxattr((dir_ / "f").c_str(), "trusted.quarn.protection_class", text, sizeof text),
              2);
    EXPECT_STREQ(text, "14");
    // Unprivileged processes use the user namespace.
    ASSERT_EQ(seteuid(65534), 0);
    std::string name = P::attributeName();
    ASSERT_EQ(seteuid(0), 0);
    EXPECT_EQ(name, "user.quarn.protection_class");
}

TEST_F(ProtectionClassAttributeTest, ItemsThatCannotHoldAClassReportBadDescriptor) {
    open(dir_ / "target");
    fs::create_symlink(dir_ / "target", dir_ / "link");
    ASSERT_EQ(mkfifo((dir_ / "fifo").c_str(), 0600), 0);
    for (int fd : {open(dir_ / "link", O_PATH | O_NOFOLLOW),
                   open(dir_ / "fifo", O_RDWR | O_NONBLOCK), open("/dev/null", O_RDWR), -1}) {
        EXPECT_EQ(classOf(fd), -EBADF);
        auto set = P::setProtectionClass(fd, 4);
        ASSERT_FALSE(set);
        EXPECT_EQ(set.error(), EBADF);
    }
    // The link's target was left alone.
    EXPECT_EQ(classOf(open(dir_ / "target", O_RDONLY)), P::kNoClass);
}

TEST_F(ProtectionClassAttributeTest, RejectsBadClassesAndCorruptValues) {
    int fd = open(dir_ / "f");
    auto negative = P::setProtectionClass(fd, -1);
    ASSERT_FALSE(negative);
    EXPECT_EQ(negative.error(), EINVAL);
    for (std::string stored : {"", "abc", "-1", "3x", " 3", "99999999999999999999999"}) {
        ASSERT_EQ(fsetxattr(fd, P::attributeName(), stored.data(), stored.size(), 0), 0);
        EXPECT_EQ(classOf(fd), -EINVAL) << "stored \"" << stored << "\"";
    }
}
