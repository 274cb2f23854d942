// quarn_test_client: sends requests to quarnd over one connection and
// prints each reply. The integration tests run hard-linked copies of it,
// each registered in the code-signing registry with other entitlements.
//
//   quarn_test_client --socket PATH HEX...
//
// Each HEX is the CBOR of one request dictionary. Each reply is printed as
// hex CBOR on its own line. When a request gets no reply, a line "!<error>" says why and the
// client stops: 0 all answered, 1 usage or bad input, 2 cannot connect,
// 3 a request went unanswered.

#include "Client/QRNClient.h"
#include "common/shared/HexCbor.h"

#include <cstdio>
#include <string>

using quarn::test::HexCbor;

int main(int argc, char** argv) {
    if (argc < 3 || std::string(argv[1]) != "--socket") {
        std::fprintf(stderr, "usage: %s --socket PATH HEX...\n", argv[0]);
        return 1;
    }
    auto client = quarn::QRNClient::connect(argv[2]);
    if (!client) {
        std::printf("!%s\n", client.error().description().c_str());
        return 2;
    }
    for (int i = 3; i < argc; ++i) {
        auto request = HexCbor::decode(argv[i]);
        if (!request) {
            std::fprintf(stderr, "bad request %s\n", argv[i]);
            return 1;
        }
        auto reply = client->send(*request);
        if (!reply) {
            std::printf("!%s\n", reply.error().description().c_str());
            return 3;
        }
        std::printf("%s\n", HexCbor::encode(*reply).c_str());
        std::fflush(stdout);
    }
    return 0;
}
