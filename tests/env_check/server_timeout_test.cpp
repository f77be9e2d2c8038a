#include <chrono>

#include "env_check.h"
#include "env_check/peer.h"
#include "status.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/wait.h"

using namespace std::chrono_literals;

namespace {

TEST(ServerTimeoutTest, IdlePassReturnsTrueAfterThirtySeconds) {
    test::makeDirectories("/tmp/ha");
    localIP("127.0.0.2");
    TERN::HA::Daemon::Status status;
    const test::Stopwatch watch;
    EXPECT_TRUE(SocketServer()(status));
    EXPECT_GE(watch.elapsed(), 30s);
    EXPECT_LT(watch.elapsed(), 60s);
    EXPECT_EQ(test::bufferText(), "");
    EXPECT_TRUE(test::isBound("127.0.0.2", test::PEER_PORT));
}

}  // namespace
