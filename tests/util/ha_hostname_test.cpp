#include <string>

#include "support/files.h"
#include "support/sandbox.h"
#include "util.h"

using TERN::HA::Daemon::Util::getHAHostname;
using test::LogLine;
using test::writeFile;
using ::testing::ElementsAre;

namespace {

constexpr const char* HA_CONFIG = "/usr/tern/etc/packages/FailoverPair/ha.conf";

class HaHostnameTest : public test::SandboxTest {
 protected:
    void expectNone() {
        EXPECT_EQ(getHAHostname(), "");
        EXPECT_THAT(test::daemonLogMessages(), ElementsAre(LogLine("util.cpp", "Failed to get ha hostname")));
    }
};

TEST_F(HaHostnameTest, IsReadFromThePackageConfiguration) {
    writeFile(HA_CONFIG, "ha_ip=10.0.0.9\nha_hostname=pair1\nother=x\n");
    EXPECT_EQ(getHAHostname(), "pair1");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(HaHostnameTest, IsReadOnEveryCall) {
    writeFile(HA_CONFIG, "ha_hostname=pair1\n");
    EXPECT_EQ(getHAHostname(), "pair1");
    writeFile(HA_CONFIG, "ha_hostname=pair2\n");
    EXPECT_EQ(getHAHostname(), "pair2");
}

TEST_F(HaHostnameTest, MissingKeyIsLogged) {
    writeFile(HA_CONFIG, "hostname=pair1\nha_hostname2=pair2\n");
    expectNone();
}

TEST_F(HaHostnameTest, MissingFileIsLogged) {
    expectNone();
}

TEST_F(HaHostnameTest, DirectoryInPlaceOfTheFileIsLogged) {
    test::makeDirectories(HA_CONFIG);
    expectNone();
}

TEST_F(HaHostnameTest, EmptyValueIsNoFailure) {
    writeFile(HA_CONFIG, "ha_hostname=\n");
    EXPECT_EQ(getHAHostname(), "");
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(HaHostnameTest, IsTruncatedTo63Characters) {
    writeFile(HA_CONFIG, "ha_hostname=" + std::string(63, 'p') + "\n");
    EXPECT_EQ(getHAHostname(), std::string(63, 'p'));
    writeFile(HA_CONFIG, "ha_hostname=" + std::string(63, 'p') + "air\n");
    EXPECT_EQ(getHAHostname(), std::string(63, 'p'));
    EXPECT_EQ(test::bufferText(), "");
}

}  // namespace
