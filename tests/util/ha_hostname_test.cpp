#include <string>

#include "support/files.h"
#include "support/sandbox.h"
#include "util.h"

using TERN::HA::Daemon::Util::getHAHostname;
using test::LogLine;
using test::writeFile;
using ::testing::ElementsAre;

namespace {

constexpr const char* kConfig = "/usr/tern/etc/packages/FailoverPair/ha.conf";

class HaHostnameTest : public test::SandboxTest {
 protected:
    void expectNone() {
        EXPECT_EQ(getHAHostname(), "");
        EXPECT_THAT(test::daemonLogMessages(), ElementsAre(LogLine("util.cpp", "Failed to get ha hostname")));
    }
};

TEST_F(HaHostnameTest, IsReadFromThePackageConfiguration) {
    writeFile(kConfig, "ha_ip=10.0.0.9\nha_hostname=pair1\nother=x\n");
    EXPECT_EQ(getHAHostname(), "pair1");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(HaHostnameTest, IsReadOnEveryCall) {
    writeFile(kConfig, "ha_hostname=pair1\n");
    EXPECT_EQ(getHAHostname(), "pair1");
    writeFile(kConfig, "ha_hostname=pair2\n");
    EXPECT_EQ(getHAHostname(), "pair2");
}

TEST_F(HaHostnameTest, AMissingKeyLeavesOneLineInTheLog) {
    writeFile(kConfig, "hostname=pair1\nha_hostname2=pair2\n");
    expectNone();
}

TEST_F(HaHostnameTest, AMissingFileLeavesOneLineInTheLog) {
    expectNone();
}

TEST_F(HaHostnameTest, ADirectoryInThePlaceOfTheFileLeavesOneLineInTheLog) {
    test::makeDirectories(kConfig);
    expectNone();
}

TEST_F(HaHostnameTest, AnEmptyValueIsNoFailure) {
    writeFile(kConfig, "ha_hostname=\n");
    EXPECT_EQ(getHAHostname(), "");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(HaHostnameTest, HasAtMost63Characters) {
    writeFile(kConfig, "ha_hostname=" + std::string(63, 'p') + "\n");
    EXPECT_EQ(getHAHostname(), std::string(63, 'p'));
    writeFile(kConfig, "ha_hostname=" + std::string(63, 'p') + "air\n");
    EXPECT_EQ(getHAHostname(), std::string(63, 'p'));
    EXPECT_EQ(test::bufferText(), "");
}

}  // namespace
