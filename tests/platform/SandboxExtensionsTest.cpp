#include "Daemon/platform/LinuxSandboxExtensions.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <iterator>

using namespace quarn;

namespace {

class SandboxExtensionsTest : public quarn::test::TempRootTest {
protected:
    std::filesystem::path keyFile() const {
        return Paths(root_.path()).runDirectory() / LinuxSandboxExtensions::kKeyFileName;
    }

    SandboxExtensionToken::Key keyFromFile() const {
        std::ifstream in(keyFile(), std::ios::binary);
        const std::string bytes{std::istreambuf_iterator<char>(in), {}};
        SandboxExtensionToken::Key key{};
        EXPECT_EQ(bytes.size(), key.size());
        std::copy_n(bytes.begin(), std::min(bytes.size(), key.size()), key.begin());
        return key;
    }

    IpcPeer::AuditToken ownToken() const {
        auto peer = IpcPeer::fromPID(::getpid());
        EXPECT_TRUE(peer);
        return peer ? peer->auditToken() : IpcPeer::AuditToken{};
    }

    Paths paths() const { return Paths(root_.path()); }
};

} // namespace

TEST_F(SandboxExtensionsTest, IssuesTokensTheKeyFileVerifies) {
    LinuxSandboxExtensions extensions(paths());
    const IpcPeer::AuditToken token = ownToken();
    auto issued = extensions.issueFileExtension(SandboxExtensions::kContainerClass,
                                                "/private/var/mobile/Containers/X", token);
    ASSERT_TRUE(issued) << issued.error().description();

    struct stat st {};
    ASSERT_EQ(::stat(keyFile().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0600u);
    EXPECT_TRUE(SandboxExtensionToken::verify(*issued, keyFromFile()));

    const auto fields = SandboxExtensionToken::parse(*issued);
    ASSERT_TRUE(fields);
    EXPECT_EQ(fields->pid, static_cast<std::uint32_t>(::getpid()));
    EXPECT_EQ(fields->startTime, IpcPeer::fieldsOfAuditToken(token).startTime);
}

TEST_F(SandboxExtensionsTest, KeyIsSharedThroughTheFileAndKeptInMemory) {
    LinuxSandboxExtensions first(paths());
    LinuxSandboxExtensions second(paths());
    auto firstKey = first.key();
    auto secondKey = second.key();
    ASSERT_TRUE(firstKey && secondKey);
    EXPECT_EQ(*firstKey, *secondKey);

    // Once read, the key no longer depends on the file.
    std::filesystem::remove(keyFile());
    auto again = first.key();
    ASSERT_TRUE(again);
    EXPECT_EQ(*again, *firstKey);
}

TEST_F(SandboxExtensionsTest, UnusableKeyFilesAreReplaced) {
    std::filesystem::create_directories(keyFile().parent_path());
    for (const auto& [contents, mode] :
         {std::pair<std::string, mode_t>{"short", 0600},
          std::pair<std::string, mode_t>{std::string(32, 'k'), 0644}}) {
        std::ofstream(keyFile(), std::ios::binary | std::ios::trunc) << contents;
        ::chmod(keyFile().c_str(), mode);
        LinuxSandboxExtensions extensions(paths());
        auto key = extensions.key();
        ASSERT_TRUE(key);
        EXPECT_EQ(keyFromFile(), *key);
        EXPECT_NE(std::string(key->begin(), key->end()), contents);
        struct stat st {};
        ASSERT_EQ(::stat(keyFile().c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 07777, 0600u);
    }
}

TEST_F(SandboxExtensionsTest, RefusesEmptyPathAndPidZero) {
    LinuxSandboxExtensions extensions(paths());
    auto noPath = extensions.issueFileExtension(SandboxExtensions::kContainerClass, "", ownToken());
    ASSERT_FALSE(noPath);
    EXPECT_EQ(noPath.error().domain, Error::Domain::POSIX);

    IpcPeer::TokenFields kernel = IpcPeer::fieldsOfAuditToken(ownToken());
    kernel.pid = 0;
    auto noPid = extensions.issueFileExtension(SandboxExtensions::kContainerClass, "/p",
                                               IpcPeer::makeAuditToken(kernel));
    ASSERT_FALSE(noPid);
    EXPECT_EQ(noPid.error().domain, Error::Domain::POSIX);
}
