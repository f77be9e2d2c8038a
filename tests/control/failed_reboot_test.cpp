#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "control.h"
#include "support/json.h"
#include "support/sandbox.h"

// Interposes the library's operator, which never fails.
bool TERN::HA::Daemon::RebootRemote::operator()(Status& /*status*/) {
    return false;
}

namespace {

using namespace TERN::HA::Daemon;
using ::testing::ElementsAre;

class FailedRebootTest : public test::SandboxTest {};

TEST_F(FailedRebootTest, IsLoggedWithoutAReply) {
    Status status;
    MonitordSocket server("/tmp/control.sock", 0);
    server.setStatus(&status);
    Json::Value reply;
    EXPECT_FALSE(server.serverHandle(test::parsed(R"({"act":"R"})"), reply));
    EXPECT_TRUE(reply.isNull());
    EXPECT_THAT(test::daemonLogMessages(),
                ElementsAre(test::LogLine("control.cpp", "Failed to reboot remote")));
}

}  // namespace
