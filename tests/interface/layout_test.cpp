#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "checker.h"
#include "chkstate.h"
#include "control.h"
#include "daemon_log.h"
#include "env_check.h"
#include "socket.h"
#include "status.h"

// Host daemons are compiled against these layouts: a change breaks all that are not rebuilt. This
// file is compiled without access control, to reach private fields.

#pragma GCC diagnostic ignored "-Winvalid-offsetof"

namespace {

using namespace TERN::HA::Daemon;

static_assert(sizeof(void*) == 8 || sizeof(void*) == 4);

// Select the value for 64-bit machines or 32-bit ARM.
constexpr std::size_t bits(std::size_t for64, std::size_t for32) {
    return sizeof(void*) == 8 ? for64 : for32;
}

TEST(ObjectLayout, Status) {
    EXPECT_EQ(sizeof(Status), bits(248, 144));
    EXPECT_EQ(alignof(Status), bits(8, 4));
    EXPECT_EQ(offsetof(Status, isRemoteMDResync), bits(0, 0));
    EXPECT_EQ(offsetof(Status, isRemoteDiskErrHandling), bits(1, 1));
    EXPECT_EQ(offsetof(Status, isMDResync), bits(2, 2));
    EXPECT_EQ(offsetof(Status, isDiskErrHandling), bits(3, 3));
    EXPECT_EQ(offsetof(Status, isDRBDConnect), bits(4, 4));
    EXPECT_EQ(offsetof(Status, heartbeatPacketFailRate), bits(8, 8));
    EXPECT_EQ(offsetof(Status, heartbeatLatency), bits(12, 12));
    EXPECT_EQ(offsetof(Status, errHandlingDisk), bits(16, 16));
    EXPECT_EQ(offsetof(Status, errHandlingDiskMutex), bits(64, 40));
    EXPECT_EQ(offsetof(Status, errHandlingDiskRemote), bits(104, 64));
    EXPECT_EQ(offsetof(Status, errHandlingDiskRemoteMutex), bits(152, 88));
    EXPECT_EQ(offsetof(Status, remoteNodeState), bits(192, 112));
    EXPECT_EQ(offsetof(Status, remoteNodeStateMutex), bits(200, 116));
    EXPECT_EQ(offsetof(Status, lockTimeout), bits(240, 140));
}

TEST(ObjectLayout, HASocketComm) {
    EXPECT_EQ(sizeof(HASocketComm), bits(40, 36));
    EXPECT_EQ(alignof(HASocketComm), bits(8, 4));
    EXPECT_EQ(offsetof(HASocketComm, sockFd), bits(8, 4));
    EXPECT_EQ(offsetof(HASocketComm, peerAddr), bits(12, 8));
    EXPECT_EQ(offsetof(HASocketComm, recvTimeout), bits(28, 24));
    EXPECT_EQ(offsetof(HASocketComm, hasError), bits(36, 32));
}

TEST(ObjectLayout, HASocketCommServer) {
    EXPECT_EQ(sizeof(HASocketCommServer), bits(48, 40));
    EXPECT_EQ(alignof(HASocketCommServer), bits(8, 4));
    EXPECT_EQ(offsetof(HASocketCommServer, peerAddrLen), bits(40, 36));
}

TEST(ObjectLayout, HASocketCommClient) {
    EXPECT_EQ(sizeof(HASocketCommClient), bits(40, 36));
    EXPECT_EQ(alignof(HASocketCommClient), bits(8, 4));
}

TEST(ObjectLayout, EnvCheck) {
    EXPECT_EQ(sizeof(EnvCheck), bits(8, 4));
    EXPECT_EQ(alignof(EnvCheck), bits(8, 4));
}

TEST(ObjectLayout, CheckerFactory) {
    EXPECT_EQ(sizeof(CheckerFactory), bits(1, 1));
    EXPECT_EQ(alignof(CheckerFactory), bits(1, 1));
}

TEST(ObjectLayout, SocketServer) {
    EXPECT_EQ(sizeof(SocketServer), bits(1, 1));
    EXPECT_EQ(alignof(SocketServer), bits(1, 1));
}

TEST(ObjectLayout, IsRemoteAlive) {
    EXPECT_EQ(sizeof(IsRemoteAlive), bits(8, 4));
    EXPECT_EQ(alignof(IsRemoteAlive), bits(8, 4));
}

TEST(ObjectLayout, CheckerRegisterIsRemoteAlive) {
    EXPECT_EQ(sizeof(CheckerRegister<IsRemoteAlive>), bits(1, 1));
    EXPECT_EQ(alignof(CheckerRegister<IsRemoteAlive>), bits(1, 1));
}

TEST(ObjectLayout, DaemonLog) {
    EXPECT_EQ(sizeof(DaemonLog), bits(136, 88));
    EXPECT_EQ(alignof(DaemonLog), bits(8, 4));
    EXPECT_EQ(offsetof(DaemonLog, _logPath), bits(0, 0));
    EXPECT_EQ(offsetof(DaemonLog, _bufferPath), bits(32, 24));
    EXPECT_EQ(offsetof(DaemonLog, _rotateFiles), bits(64, 48));
    EXPECT_EQ(offsetof(DaemonLog, _mutex), bits(88, 60));
    EXPECT_EQ(offsetof(DaemonLog, _lockTimeout), bits(128, 84));
}

TEST(ObjectLayout, DaemonLocalSocket) {
    EXPECT_EQ(sizeof(DaemonLocalSocket), bits(2152, 2136));
    EXPECT_EQ(alignof(DaemonLocalSocket), bits(8, 4));
    EXPECT_EQ(offsetof(DaemonLocalSocket, _path), bits(8, 4));
    EXPECT_EQ(offsetof(DaemonLocalSocket, _timeout), bits(40, 28));
    EXPECT_EQ(offsetof(DaemonLocalSocket, _hasError), bits(44, 32));
    EXPECT_EQ(offsetof(DaemonLocalSocket, _fd), bits(48, 36));
    EXPECT_EQ(offsetof(DaemonLocalSocket, _buffer), bits(52, 40));
}

TEST(ObjectLayout, MonitordSocket) {
    EXPECT_EQ(sizeof(MonitordSocket), bits(2160, 2140));
    EXPECT_EQ(alignof(MonitordSocket), bits(8, 4));
    EXPECT_EQ(offsetof(MonitordSocket, _status), bits(2152, 2136));
}

TEST(ObjectLayout, CommandPipe) {
    EXPECT_EQ(sizeof(CommandPipe), bits(48, 32));
    EXPECT_EQ(alignof(CommandPipe), bits(8, 4));
    EXPECT_EQ(offsetof(CommandPipe, _fp), bits(0, 0));
    EXPECT_EQ(offsetof(CommandPipe, _failed), bits(8, 4));
    EXPECT_EQ(offsetof(CommandPipe, _command), bits(16, 8));
}

TEST(ObjectLayout, InterfaceChecker) {
    EXPECT_EQ(sizeof(InterfaceChecker), bits(16, 16));
    EXPECT_EQ(alignof(InterfaceChecker), bits(8, 8));
    EXPECT_EQ(offsetof(InterfaceChecker, _lastOkTotal), bits(0, 0));
    EXPECT_EQ(offsetof(InterfaceChecker, _lastNonOkTotal), bits(8, 8));
}

// Return the index of a virtual function in its class's table, from 1; 0 for a function that is not
// virtual.
template <class Member>
std::size_t slot(Member member) {
    std::ptrdiff_t words[2] = {};
    static_assert(sizeof words == sizeof member);
    std::memcpy(words, &member, sizeof words);
#ifdef __arm__
    const bool isVirtual = (words[1] & 1) != 0;
    const std::ptrdiff_t offset = words[0];
#else
    const bool isVirtual = (words[0] & 1) != 0;
    const std::ptrdiff_t offset = words[0] - 1;
#endif
    return isVirtual ? static_cast<std::size_t>(offset) / sizeof(void*) + 1 : 0;
}

TEST(VirtualSlots, Checks) {
    EXPECT_EQ(slot<bool (EnvCheck::*)()>(&EnvCheck::operator()), 1U);
    EXPECT_EQ(slot<bool (EnvCheck::*)(Json::Value&)>(&EnvCheck::operator()), 2U);
    EXPECT_EQ(slot(&EnvCheck::handle), 3U);
    EXPECT_EQ(slot(&EnvCheck::getType), 4U);
    EXPECT_EQ(slot(&EnvCheck::_sendToRemote), 0U);
    EXPECT_EQ(slot<bool (RebootRemote::*)(Status&)>(&RebootRemote::operator()), 0U);
    EXPECT_EQ(slot<bool (GetRemoteHostname::*)(std::string&)>(&GetRemoteHostname::operator()), 0U);
}

TEST(VirtualSlots, Transport) {
    EXPECT_EQ(slot(&HASocketComm::Recv), 1U);
    EXPECT_EQ(slot(&HASocketComm::Send), 0U);
    EXPECT_EQ(slot(&HASocketComm::HasError), 0U);
}

TEST(VirtualSlots, ControlSocket) {
    EXPECT_EQ(slot(&DaemonLocalSocket::serverHandle), 1U);
    EXPECT_EQ(slot(&MonitordSocket::serverHandle), 1U);
    EXPECT_EQ(slot(&DaemonLocalSocket::_serverListen), 0U);
}

TEST(VirtualSlots, NoClassHasAVirtualDestructor) {
    EXPECT_FALSE(std::has_virtual_destructor_v<EnvCheck>);
    EXPECT_FALSE(std::has_virtual_destructor_v<HASocketComm>);
    EXPECT_FALSE(std::has_virtual_destructor_v<DaemonLocalSocket>);
    EXPECT_FALSE(std::is_polymorphic_v<Status>);
    EXPECT_FALSE(std::is_polymorphic_v<SocketServer>);
    EXPECT_FALSE(std::is_polymorphic_v<InterfaceChecker>);
    EXPECT_FALSE(std::is_polymorphic_v<DaemonLog>);
}

}  // namespace
