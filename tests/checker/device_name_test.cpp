#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "checker.h"
#include "support/sandbox.h"
#include "terncore.h"

namespace {

struct Call {
    std::string port;
    int size;
    std::string buffer;  // as it was handed in
};

std::vector<Call> calls;
int result = 0;
std::string name;

}  // namespace

// Interposes the function of the platform library.
int TERNDiskGetDevnamebyAtaPort(char* buffer, int size, const char* port) {
    calls.push_back({port, size, std::string(buffer, static_cast<std::size_t>(size))});
    name.copy(buffer, name.size());
    return result;
}

namespace {

using TERN::HA::Daemon::devNameByAtaPath;

class DeviceNameTest : public test::SandboxTest {
 protected:
    void SetUp() override {
        test::SandboxTest::SetUp();
        calls.clear();
        result = 0;
        name = "sda";
    }

    static bool find(std::string path, std::string& found) { return devNameByAtaPath(path.data(), found); }

    std::string device = "unchanged";
};

TEST_F(DeviceNameTest, LastPathComponentIsPassedToThePlatform) {
    for (const char* path : {"/sys/class/ata_port/ata3", "ata3", "/sys/class/ata_port/ata3/"}) {
        EXPECT_TRUE(find(path, device));
        EXPECT_EQ(device, "sda");
        EXPECT_EQ(calls.back().port, "ata3");
        EXPECT_EQ(calls.back().size, 8);
        EXPECT_EQ(calls.back().buffer, std::string(8, '\0'));
    }
}

TEST_F(DeviceNameTest, OnlyMinusOneIsAFailure) {
    for (const int value : {1, 2, -2, 0}) {
        result = value;
        EXPECT_TRUE(find("ata1", device)) << value;
        EXPECT_EQ(device, "sda");
    }
    result = -1;
    device = "unchanged";
    EXPECT_FALSE(find("ata1", device));
    EXPECT_EQ(device, "unchanged");
    EXPECT_THAT(test::daemonLogMessages(), ::testing::IsEmpty());
}

TEST_F(DeviceNameTest, NameHasUpToSevenCharacters) {
    name = "sdabcde";
    EXPECT_TRUE(find("ata1", device));
    EXPECT_EQ(device, "sdabcde");
    name = "";
    EXPECT_TRUE(find("ata1", device));
    EXPECT_EQ(device, "");
}

}  // namespace
