#include "checker.h"
#include "support/files.h"
#include "support/sandbox.h"
#include "util.h"

namespace {

using TERN::HA::Daemon::Util::devListToHumanReadable;
using ::testing::ElementsAre;

class PlainCTest : public test::SandboxTest {};

TEST_F(PlainCTest, MissingFileIsMissing) {
    EXPECT_THAT(devListToHumanReadable({"sda"}), ElementsAre("sda"));
    EXPECT_EQ(test::bufferText(), "");
}

TEST_F(PlainCTest, ExistingFileExists) {
    test::writeFile("/tmp/ha/info_hd.remote", R"({"3":{"HD_DEVNAME":"sda"}})");
    EXPECT_THAT(devListToHumanReadable({"sda"}), ElementsAre("Disk 3"));
}

TEST_F(PlainCTest, ArgumentsEndWithTwoNulls) {
    EXPECT_TRUE(TERN::HA::Daemon::isHadConstraints());
}

}  // namespace
