#include <syslog.h>

#include <algorithm>
#include <map>

#include "checker.h"
#include "control.h"
#include "env_check.h"
#include "faults/failing_call.h"
#include "status.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "support/system_log.h"
#include "util.h"

using namespace TERN::HA::Daemon;
using ::testing::ElementsAre;

namespace {

// Return the source files that logged, each with whether the logged line numbers are those of the
// source lines that hold the text.
std::map<std::string, bool> callSites(const std::vector<std::string>& messages) {
    std::map<std::string, bool> found;
    for (const std::string& message : messages) {
        EXPECT_TRUE(test::hasCallSite(message)) << message;
        const std::string file = message.substr(0, message.find(':'));
        const auto number = std::stoul(message.substr(file.size() + 1));
        const std::string line = test::lines(test::readFile(LIBRARY_SOURCES "/" + file)).at(number - 1);
        const std::string text = message.substr(message.find(' ') + 1, 8);
        const bool isThere = line.find(text) != std::string::npos;
        EXPECT_TRUE(isThere) << message << "\nis not logged by\n" << line;
        found.emplace(file, true).first->second &= isThere;
    }
    return found;
}

class CallSiteTest : public test::SandboxTest {};

// One message of each source file that logs: all use the same two macros.
TEST_F(CallSiteTest, LogLinesNameTheirCallSite) {
    Status status;
    Json::Value reply;
    test::SystemLog systemLog;
    MonitordSocket client("/tmp/nowhere", 1);
    EXPECT_FALSE(client.getServerData(reply));
    {
        const test::FailingCall failing("socket", EMFILE);
        EXPECT_FALSE(IsRemoteAlive()());
    }
    EXPECT_FALSE(client.serverHandle({}, reply));
    EXPECT_FALSE(isDRBDConnect());
    EXPECT_EQ(Util::getHAHostname(), "");
    status.setRemoteAlive(true);

    EXPECT_THAT(callSites(test::daemonLogMessages()),
                ElementsAre(std::pair("checker.cpp", true), std::pair("control.cpp", true),
                            std::pair("env_check.cpp", true), std::pair("status.cpp", true),
                            std::pair("util.cpp", true)));
    EXPECT_THAT(callSites(systemLog.texts()),
                ElementsAre(std::pair("chkstate.cpp", true), std::pair("socket.cpp", true)));
    closelog();
}

}  // namespace
