#pragma once
// Sandbox extension tokens in replies: a sandboxed client gets a token for a
// container's path only when the container lives in an enterprise persona
// and its class has an extension class. Sandboxed clients of other personas
// reach their containers through the sandbox's own rules, so they get none
// on purpose.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class QRNClientConnection;
class QRNMetadata;

class QRNSandboxTokens {
public:
    // Classes 2, 4, 6 and 10: the container class; 7: the application
    // group class; any other: empty.
    static std::string_view extensionClassForContainerClass(std::uint64_t containerClass);

    // The token for the client's process, or none when the rule gives none
    // or issuing fails (both logged for a sandboxed client).
    static std::optional<std::string> sandboxTokenForContainer(const QRNClientConnection& client,
                                                               const QRNMetadata& metadata);
};

} // namespace quarn
