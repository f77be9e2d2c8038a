#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <optional>

#include "support/sandbox.h"
#include "ternhad/control_tool.h"
#include "ternhad/daemon.h"
#include "ternhad/played_peer.h"

namespace {

using namespace std::chrono_literals;
using test::control;
using ::testing::ContainsRegex;
using ::testing::HasSubstr;
using ::testing::Not;

bool eventuallyPrints(const std::string& arguments, const std::string& text) {
    return test::eventually(20s, [&] { return control(arguments).output.find(text) != std::string::npos; });
}

// A daemon on 127.0.0.1 with a peer that resynchronises nothing, and has told so.
class StaleTest : public ::testing::Test {
 protected:
    StaleTest() : daemon(test::daemonArguments("127.0.0.1", "127.0.0.2", "lo", {"--dead-after", "1"})) {
        EXPECT_TRUE(test::eventually(10s, [] { return !test::statusAt().isNull(); })) << daemon.error();
        EXPECT_EQ(control("wait peer-no-resync --timeout 20").exitCode, 0);
        EXPECT_EQ(control("wait peer-no-disk-errors --timeout 20").exitCode, 0);
    }

    std::optional<test::PlayedPeer> peer{std::in_place};
    test::Process daemon;
};

TEST_F(StaleTest, StateOfADeadPeerIsStaleUntilItReportsAgain) {
    peer.reset();
    ASSERT_EQ(control("wait peer-dead --timeout 20").exitCode, 0);
    EXPECT_EQ(control("wait peer-no-resync --timeout 0.2").exitCode, 1);
    EXPECT_EQ(control("wait peer-resync --timeout 0.2").exitCode, 1);
    EXPECT_THAT(control("disks").output, ContainsRegex("^peer, last known [0-9]+ s ago: none\n$"));

    test::Process follower({TERNHACTL, "events"});
    test::Process waiter({TERNHACTL, "wait", "peer-no-resync", "--timeout", "60"});
    EXPECT_FALSE(waiter.waitFor(500ms).has_value());
    peer.emplace();
    EXPECT_EQ(waiter.waitFor(20s), 0);
    EXPECT_TRUE(test::eventually(
        20s, [&] { return follower.output().find(" peer-no-resync (was unknown)\n") != std::string::npos; }));
    EXPECT_EQ(control("wait peer-no-resync --timeout 0.2").exitCode, 0);
    EXPECT_THAT(control("metrics").output, HasSubstr("ternha_transitions_total{flag=\"peer-resync\"} 0\n"));
}

TEST_F(StaleTest, StateOfAnAlivePeerThatStopsReportingIsLastKnown) {
    EXPECT_THAT(control("metrics").output, HasSubstr("\nternha_peer_md_resync 0\n"));
    peer->ignore("is_md_resync");
    EXPECT_TRUE(eventuallyPrints("status --json=1", R"("stale":true,"value":false)"));
    const std::string status = control("status").output;
    EXPECT_THAT(status, ContainsRegex("  state             alive since .*, last reply [0-9]+ s ago\n"));
    EXPECT_THAT(status, ContainsRegex("  RAID resync       no \\(last known [0-9]+ s ago\\)\n"));
    EXPECT_THAT(status, HasSubstr("  disk errors       no\n"));
    EXPECT_THAT(control("check").output, ContainsRegex("peer's RAID and disks last known [0-9]+ s ago"));
    EXPECT_THAT(control("metrics").output, Not(HasSubstr("\nternha_peer_md_resync ")));
    EXPECT_EQ(control("wait peer-no-resync --timeout 0.2").exitCode, 1);

    peer->setReply("is_md_resync", "not_resync");
    EXPECT_EQ(control("wait peer-no-resync --timeout 20").exitCode, 0);
    EXPECT_THAT(control("metrics").output, HasSubstr("\nternha_peer_md_resync 0\n"));
}

TEST_F(StaleTest, ResyncReportedAfterThePeerWasDeclaredDeadIsDiscarded) {
    peer->dieAt("is_md_resync");
    ASSERT_EQ(control("wait peer-dead --timeout 20").exitCode, 0);
    peer->replyLate("resync");
    EXPECT_EQ(control("wait peer-resync --timeout 0.5").exitCode, 1);
}

TEST_F(StaleTest, NoResyncReportedAfterThePeerWasDeclaredDeadIsDiscarded) {
    peer->dieAt("is_md_resync");
    ASSERT_EQ(control("wait peer-dead --timeout 20").exitCode, 0);
    peer->replyLate("not_resync");
    EXPECT_EQ(control("wait peer-no-resync --timeout 0.5").exitCode, 1);
}

}  // namespace
