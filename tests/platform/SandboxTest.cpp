// Sandbox extension tokens, their issuer with its key file, and the
// in-memory sandbox kernel.

#include "Daemon/platform/LinuxSandboxExtensions.h"
#include "Daemon/platform/SandboxExtensionToken.h"
#include "Daemon/platform/SandboxKernel.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <fmt/format.h>

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <ranges>
#include <vector>

using namespace quarn;

namespace {

using Token = SandboxExtensionToken;
using Parts = std::vector<std::string>;

Token::Key keyOf(std::uint8_t fill) {
    Token::Key key;
    key.fill(fill);
    return key;
}

Parts partsOf(const std::string& token) {
    Parts parts;
    for (const auto part : token | std::views::split(';')) {
        parts.emplace_back(part.begin(), part.end());
    }
    return parts;
}

// The token of `parts` with the one at `index` replaced by `value`.
std::string with(Parts parts, std::size_t index, std::string value) {
    parts[index] = std::move(value);
    return fmt::format("{}", fmt::join(parts, ";"));
}

const std::string kClass = "com.orvex.sandbox.container";
const std::string kPath = "/private/var/mobile/Containers/Data/Application/X;Y";

SandboxItem item(std::string id, std::uint64_t cls, std::string path) {
    return SandboxItem{1, std::move(id), cls, 501, std::move(path)};
}

} // namespace

TEST(SandboxExtensionTokenTest, VerifiesOnlyUnderItsKeyWithEveryFieldInItsOnlySpelling) {
    const auto token = Token::make(keyOf(7), kClass, kPath, 4242, 123456789);
    ASSERT_TRUE(token);
    const auto fields = Token::parse(*token);
    ASSERT_TRUE(fields);
    EXPECT_EQ(std::tie(fields->extensionClass, fields->path, fields->pid, fields->startTime),
              std::make_tuple(kClass, kPath, 4242u, 123456789u));
    EXPECT_TRUE(Token::verify(*token, keyOf(7)));
    EXPECT_FALSE(Token::verify(*token, keyOf(8)));

    // Forged fields parse but do not verify; the last hex digit flipped
    // (0 <-> 1) keeps a field lower-case hex.
    const Parts parts = partsOf(*token);
    ASSERT_EQ(parts.size(), 6u);
    const auto flipped = [&](std::size_t i) {
        return with(parts, i,
                    parts[i].substr(0, parts[i].size() - 1) + (parts[i].back() == '0' ? '1' : '0'));
    };
    for (const auto& forged :
         {with(parts, 1, "com.orvex.sandbox.application-group"), with(parts, 2, "4243"),
          with(parts, 3, "123456788"), flipped(4), flipped(5)}) {
        EXPECT_TRUE(Token::parse(forged)) << forged;
        EXPECT_FALSE(Token::verify(forged, keyOf(7))) << forged;
    }
    // Class "a.b" with path "/c" and class "a" with path ".b/c" concatenate
    // alike; the MAC of one must not carry over to the other.
    const auto first = Token::make(keyOf(3), "a.b", "/c", 1, 2);
    const auto second = Token::make(keyOf(3), "a", ".b/c", 1, 2);
    ASSERT_TRUE(first && second);
    EXPECT_FALSE(Token::verify(with(partsOf(*second), 5, partsOf(*first)[5]), keyOf(3)));

    // Fields that cannot be written, garbage and second spellings.
    for (const char* cls : {"", "a;b", "with space"}) {
        EXPECT_FALSE(Token::make(keyOf(7), cls, kPath, 1, 1)) << cls;
    }
    for (const auto& path : {std::string(), std::string(Token::kMaxPathSize + 1, 'p')}) {
        EXPECT_FALSE(Token::make(keyOf(7), kClass, path, 1, 1)) << path.size();
    }
    std::string upper = parts[5];
    std::ranges::transform(upper, upper.begin(), [](char c) { return std::toupper(c); });
    for (const auto& text :
         {std::string(), std::string("v1"), with(parts, 0, "v2"), *token + ";extra",
          token->substr(0, token->rfind(';')), with(parts, 2, "04242"), with(parts, 2, "+4242"),
          with(parts, 2, "4294967296"), with(parts, 3, "-1"), with(parts, 4, ""),
          with(parts, 4, parts[4] + "0"), with(parts, 4, "zz"), with(parts, 5, parts[5].substr(2)),
          with(parts, 5, upper), std::string(20000, 'a')}) {
        EXPECT_FALSE(Token::parse(text)) << text;
        EXPECT_FALSE(Token::verify(text, keyOf(7))) << text;
    }
}

// The issuer's key: made in a file of its own (mode 0600) that other
// issuers share, kept in memory once read, replaced when unusable.
TEST(SandboxExtensionsTest, IssuesTokensUnderTheKeyOfItsFileAndRefusesEmptyPathAndPidZero) {
    quarn::test::TempRoot root;
    const Paths paths(root.path());
    const auto keyFile = paths.runDirectory() / LinuxSandboxExtensions::kKeyFileName;
    const auto keyInFile = [&] {
        EXPECT_EQ(std::filesystem::status(keyFile).permissions(),
                  std::filesystem::perms::owner_read | std::filesystem::perms::owner_write);
        std::ifstream in(keyFile, std::ios::binary);
        return std::string{std::istreambuf_iterator<char>(in), {}};
    };
    const auto keyOf = [](LinuxSandboxExtensions& extensions) {
        const auto key = extensions.key();
        EXPECT_TRUE(key);
        return key ? std::string(key->begin(), key->end()) : std::string();
    };

    LinuxSandboxExtensions extensions(paths);
    auto peer = IpcPeer::fromPID(::getpid());
    ASSERT_TRUE(peer);
    auto issued = extensions.issueFileExtension(
        SandboxExtensions::kContainerClass, "/private/var/mobile/Containers/X", peer->auditToken());
    ASSERT_TRUE(issued) << issued.error().description();
    const std::string key = keyOf(extensions);
    EXPECT_EQ(keyInFile(), key);
    EXPECT_TRUE(Token::verify(*issued, *extensions.key()));
    const auto fields = Token::parse(*issued);
    ASSERT_TRUE(fields);
    IpcPeer::TokenFields self = IpcPeer::fieldsOfAuditToken(peer->auditToken());
    EXPECT_EQ(std::tie(fields->pid, fields->startTime), std::tie(self.pid, self.startTime));
    self.pid = 0; // the kernel
    for (const auto& [path, token] :
         {std::pair{"", peer->auditToken()}, std::pair{"/p", IpcPeer::makeAuditToken(self)}}) {
        auto refused =
            extensions.issueFileExtension(SandboxExtensions::kContainerClass, path, token);
        ASSERT_FALSE(refused) << path;
        EXPECT_EQ(refused.error().domain, Error::Domain::POSIX) << path;
    }

    LinuxSandboxExtensions second(paths);
    EXPECT_EQ(keyOf(second), key);
    std::filesystem::remove(keyFile);
    EXPECT_EQ(keyOf(extensions), key); // kept in memory
    // A short or readable key file is replaced.
    for (const auto& [contents, mode] :
         {std::pair<std::string, mode_t>{"short", 0600},
          std::pair<std::string, mode_t>{std::string(32, 'k'), 0644}}) {
        std::ofstream(keyFile, std::ios::binary | std::ios::trunc) << contents;
        ::chmod(keyFile.c_str(), mode);
        LinuxSandboxExtensions fresh(paths);
        const std::string freshKey = keyOf(fresh);
        EXPECT_EQ(keyInFile(), freshKey);
        EXPECT_NE(freshKey, contents);
    }
}

TEST(SandboxKernel, MappingsArePerUserAndReplaceByIdentity) {
    InMemorySandboxKernel k;
    EXPECT_EQ(k.setContainerMapping(501, item("com.a", 2, "/c/A")), 0);
    EXPECT_EQ(k.setContainerMapping(501, item("com.a", 2, "/c/B")), 0); // same container, new path
    EXPECT_EQ(k.setContainerMapping(501, item("com.a", 4, "/c/P")), 0);
    EXPECT_EQ(k.setContainerMapping(502, item("com.a", 2, "/d/A")), 0);
    std::vector<std::string> paths;
    k.forEachItem(501, [&](const SandboxItem& i) {
        paths.push_back(i.path);
        return true;
    });
    EXPECT_EQ(paths, (std::vector<std::string>{"/c/B", "/c/P"}));
    EXPECT_EQ(k.count(502), 1u);

    EXPECT_EQ(k.removeContainerMapping(501, item("com.a", 2, "")), 0);
    EXPECT_EQ(k.removeContainerMapping(501, item("com.a", 2, "")), ENOENT);
    EXPECT_EQ(k.setContainerMapping(501, item("", 2, "/x")), EINVAL);

    // Iteration stops when asked and tolerates removal from inside.
    for (int i = 0; i < 4; ++i) {
        k.setContainerMapping(501, item("id" + std::to_string(i), 2, "/p"));
    }
    int seen = 0;
    k.forEachItem(501, [&](const SandboxItem& i) {
        k.removeContainerMapping(501, i); // must not deadlock
        return ++seen < 3;
    });
    EXPECT_EQ(seen, 3);
    EXPECT_EQ(k.count(501), 2u);
}
