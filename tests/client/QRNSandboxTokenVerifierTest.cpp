// Tokens from replies checked against the daemon's key file below its root.

#include "Client/QRNSandboxTokenVerifier.h"

#include "Daemon/platform/SandboxExtensionToken.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

using namespace quarn;
using namespace quarn::test;

TEST(QRNSandboxTokenVerifier, AcceptsOnlyTokensOfTheDaemonsCurrentKey) {
    TempRoot root(TempRoot::Options{.withMobileUser = true, .installContext = false});
    SandboxExtensionToken::Key key{}, otherKey{};
    key.fill(0x5A);
    otherKey.fill(0x33);
    auto token = SandboxExtensionToken::make(key, "com.orvex.sandbox.container",
                                             "/private/var/mobile/Containers/Data/X", 42, 1000);
    ASSERT_TRUE(token);

    auto noKeyYet = QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path());
    ASSERT_FALSE(noKeyYet);
    EXPECT_TRUE(noKeyYet.error().isPOSIX(ENOENT));

    const std::string keyFile = "/private/var/run/quarnd/extension.key";
    root.writeFile(keyFile, std::string(key.begin(), key.end()));
    EXPECT_EQ(QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path()).value_or(false),
              true);
    auto tampered = *token;
    tampered[tampered.size() - 1] = tampered.back() == '0' ? '1' : '0';
    EXPECT_EQ(QRNSandboxTokenVerifier::verifySandboxToken(tampered, root.path()).value_or(true),
              false);

    root.writeFile(keyFile, std::string(otherKey.begin(), otherKey.end()));
    EXPECT_EQ(QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path()).value_or(true),
              false);

    root.writeFile(keyFile, "short");
    auto broken = QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path());
    ASSERT_FALSE(broken);
    EXPECT_TRUE(broken.error().isPOSIX(EINVAL));
}
