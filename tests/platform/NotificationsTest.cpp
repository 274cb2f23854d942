#include "Daemon/platform/LinuxNotifications.h"
#include "Daemon/support/Descriptor.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <regex>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>
#include <vector>

using namespace quarn;

namespace {

std::vector<std::string> linesOf(const std::filesystem::path& file) {
    std::ifstream in(file);
    std::vector<std::string> lines;
    for (std::string line; std::getline(in, line);) {
        lines.push_back(line);
    }
    return lines;
}

class NotificationsTest : public quarn::test::TempRootTest {
protected:
    LinuxNotifications notifications_{Paths(root_.path())};
    std::filesystem::path fileFor(std::string_view name) const {
        return notifications_.directory() / name;
    }
};

} // namespace

TEST_F(NotificationsTest, PostsAppendOneTimestampedLinePerPostInAFileNamedAfterTheNotification) {
    const auto name = Notifications::kUserInvalidated;
    ASSERT_FALSE(std::filesystem::exists(Paths(root_.path()).runDirectory()));
    ASSERT_TRUE(notifications_.post(name));
    ASSERT_TRUE(notifications_.post(name));
    // The platform installs this poster.
    ASSERT_TRUE(root_.context().instance<Notifications>().post(Notifications::kCleanupComplete));

    EXPECT_EQ(notifications_.directory(), root_ / "/private/var/run/quarnd/notifications");
    const auto lines = linesOf(fileFor(name));
    ASSERT_EQ(lines.size(), 2u);
    const std::regex format(
        R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z com\.orvex\.quarnd\.user-invalidated)");
    for (const auto& line : lines) {
        EXPECT_TRUE(std::regex_match(line, format)) << line;
    }
    EXPECT_EQ(linesOf(fileFor(Notifications::kCleanupComplete)).size(), 1u);
}

TEST_F(NotificationsTest, NamesThatAreNoFileNamesAndPlantedLinksAreRefused) {
    for (std::string_view bad : {"", ".hidden", "..", "../../etc/passwd", "new\nline"}) {
        auto posted = notifications_.post(bad);
        ASSERT_FALSE(posted) << bad;
        EXPECT_TRUE(posted.error().isPOSIX(EINVAL)) << bad;
    }
    EXPECT_FALSE(notifications_.post(std::string(Notifications::kMaxNameLength + 1, 'a')));

    // The directory is a link.
    const auto elsewhere = root_ / "/elsewhere";
    std::filesystem::create_directories(elsewhere);
    std::filesystem::create_directories(notifications_.directory().parent_path());
    std::filesystem::create_directory_symlink(elsewhere, notifications_.directory());
    EXPECT_FALSE(notifications_.post(Notifications::kCleanupComplete));
    EXPECT_TRUE(std::filesystem::is_empty(elsewhere));
    // The file is a link to a file the daemon must not append to.
    std::filesystem::remove(notifications_.directory());
    std::filesystem::create_directories(notifications_.directory());
    root_.writeFile("/elsewhere/victim", "untouched\n");
    std::filesystem::create_symlink(elsewhere / "victim", fileFor(Notifications::kCleanupComplete));
    auto posted = notifications_.post(Notifications::kCleanupComplete);
    ASSERT_FALSE(posted);
    EXPECT_TRUE(posted.error().isPOSIX(ELOOP));
    EXPECT_EQ(linesOf(elsewhere / "victim"), std::vector<std::string>{"untouched"});
}

TEST_F(NotificationsTest, UnderAServiceManagerAPostBecomesTheStatusLine) {
    // Stands in for the service manager: a datagram socket named by NOTIFY_SOCKET.
    const auto path = root_.path() / "notify";
    const Descriptor fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_un addr{.sun_family = AF_UNIX, .sun_path = {}};
    ASSERT_LT(path.native().size(), sizeof addr.sun_path);
    std::strcpy(addr.sun_path, path.c_str());
    ASSERT_EQ(::bind(fd.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
    auto received = [&] {
        char buffer[512];
        const ssize_t n = ::recv(fd.get(), buffer, sizeof buffer, MSG_DONTWAIT);
        return n > 0 ? std::string(buffer, static_cast<std::size_t>(n)) : std::string();
    };

    const bool posted = bool(notifications_.post(Notifications::kUserInvalidated));
    const std::string status = received();
    // A refused post tells the manager nothing.
    const bool refused = !notifications_.post("a/b");
    const std::string afterRefused = received();
    ::unsetenv("NOTIFY_SOCKET");
    EXPECT_TRUE(posted);
    EXPECT_EQ(status, "STATUS=Posted com.orvex.quarnd.user-invalidated");
    EXPECT_TRUE(refused);
    EXPECT_EQ(afterRefused, "");
}
