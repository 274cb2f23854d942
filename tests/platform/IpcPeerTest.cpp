#include "Daemon/platform/IpcPeer.h"
#include "Daemon/platform/ProcessInfo.h"

#include <gtest/gtest.h>

#include <csignal>
#include <string>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

using namespace quarn;

namespace {

// A stat line whose command name holds blanks and parentheses; start time 98765.
const std::string kStat = "4242 (evil) name (x) ) S 1 4242 4242 0 -1 4194560 100 0 0 0 3 1 0 0 "
                          "20 0 1 0 98765 4096 200 18446744073709551615 1 1 0 0 0 0 0 0 0 0 0\n";

const std::string kStatus = "Name:\tclient\nUmask:\t0022\nState:\tS (sleeping)\nTgid:\t4242\n"
                            "Uid:\t501\t502\t503\t504\nGid:\t20\t21\t22\t23\nGroups:\t20 12\n";

} // namespace

TEST(IpcPeerTest, SocketPeerIsThisProcessWithItsToken) {
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    auto peer = IpcPeer::fromSocket(fds[0]);
    ::close(fds[0]);
    ::close(fds[1]);
    ASSERT_TRUE(peer) << peer.error().message;

    EXPECT_EQ(peer->pid(), ::getpid());
    EXPECT_EQ(peer->uid(), ::geteuid());
    EXPECT_EQ(peer->gid(), ::getegid());
    EXPECT_GE(peer->pidfd(), 0); // pidfd_open exists since Linux 5.3

    const auto startTime = IpcPeer::processStartTime(::getpid());
    ASSERT_TRUE(startTime);
    EXPECT_EQ(peer->startTime(), *startTime);
    const auto fields = IpcPeer::fieldsOfAuditToken(peer->auditToken());
    EXPECT_EQ(fields.pid, static_cast<std::uint32_t>(::getpid()));
    EXPECT_EQ(fields.startTime, static_cast<std::uint32_t>(*startTime));
    EXPECT_EQ(fields.euid, ::geteuid());
    EXPECT_EQ(fields.egid, ::getegid());
    EXPECT_EQ(fields.ruid, ::getuid());
    EXPECT_EQ(fields.rgid, ::getgid());
    EXPECT_EQ(fields.sessionID, static_cast<std::uint32_t>(::getsid(0)));

    auto byPID = IpcPeer::fromPID(::getpid());
    ASSERT_TRUE(byPID);
    EXPECT_EQ(byPID->auditToken(), peer->auditToken());
}

TEST(IpcPeerTest, AnotherProcessHasItsOwnTokenAndNoneOnceGone) {
    int gate[2];
    ASSERT_EQ(::pipe(gate), 0);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        ::close(gate[1]);
        char c;
        (void)!::read(gate[0], &c, 1); // until the parent closes its end
        ::_exit(0);
    }
    ::close(gate[0]);
    auto peer = IpcPeer::fromPID(child);
    ::close(gate[1]);
    ::waitpid(child, nullptr, 0);

    ASSERT_TRUE(peer);
    EXPECT_EQ(peer->pid(), child);
    EXPECT_EQ(IpcPeer::fieldsOfAuditToken(peer->auditToken()).pid,
              static_cast<std::uint32_t>(child));
    EXPECT_FALSE(IpcPeer::processStartTime(child));
    EXPECT_FALSE(IpcPeer::fromPID(child));
    EXPECT_FALSE(IpcPeer::fromPID(0));
}

TEST(IpcPeerTest, AuditTokenIsEightLittleEndianWordsInOrder) {
    const IpcPeer::TokenFields fields{0x04030201, 11, 12, 13, 14, 0x00010000, 16, 0xA1B2C3D4};
    const auto token = IpcPeer::makeAuditToken(fields);
    const std::array<std::uint8_t, 8> ends{token[0],  token[3],  token[4],  token[16],
                                           token[22], token[24], token[28], token[31]};
    EXPECT_EQ(ends, (std::array<std::uint8_t, 8>{0x01, 0x04, 11, 14, 0x01, 16, 0xD4, 0xA1}));
    const auto back = IpcPeer::fieldsOfAuditToken(token);
    EXPECT_EQ(IpcPeer::makeAuditToken(back), token);
    EXPECT_EQ(back.startTime, fields.startTime);
}

TEST(IpcPeerTest, ProcFilesAreParsedStrictly) {
    EXPECT_EQ(ProcessInfo::parseStartTime(kStat), 98765u);
    EXPECT_FALSE(ProcessInfo::parseStartTime("4242 (name S 1 2 3"));
    EXPECT_FALSE(ProcessInfo::parseStartTime("4242 (x) S 1 2 3 4 5 6 7 8 9 10"));
    EXPECT_FALSE(
        ProcessInfo::parseStartTime("1 (x) S 1 1 1 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 -5 0 0"));

    const auto ids = ProcessInfo::parseIds(kStatus);
    ASSERT_TRUE(ids);
    EXPECT_EQ(ids->realUID, 501u);
    EXPECT_EQ(ids->effectiveUID, 502u);
    EXPECT_EQ(ids->realGID, 20u);
    EXPECT_EQ(ids->effectiveGID, 21u);
    for (const char* bad : {"Uid:\t1\t1\t1\t1\n", "Uid:\t1\t1\t1\nGid:\t1\t1\t1\t1\n",
                            "Uid:\t1\tx\t1\t1\nGid:\t1\t1\t1\t1\n",
                            "Uid:\t4294967296\t1\t1\t1\nGid:\t1\t1\t1\t1\n"}) {
        EXPECT_FALSE(ProcessInfo::parseIds(bad)) << bad;
    }

    EXPECT_EQ(ProcessInfo::parseLoginUID("4294967295"), ProcessInfo::kNoLoginUID);
    EXPECT_EQ(ProcessInfo::parseLoginUID("501\n"), 501u);
    EXPECT_FALSE(ProcessInfo::parseLoginUID("-1"));
    EXPECT_FALSE(ProcessInfo::parseLoginUID(""));
}
