#include "failure_detector.h"

#include <gtest/gtest.h>

#include <chrono>
#include <deque>
#include <vector>

namespace {

using namespace std::chrono_literals;
using ternhad::FailureDetector;
using Duration = FailureDetector::Duration;
using Time = FailureDetector::Time;

// A detector on a clock of its own, whose peer replies as the test wants.
class FailureDetectorTest : public ::testing::Test {
 protected:
    enum class Sending { works, fails };

    // Runs until `time` on the clock: wakes up when the detector asks for it, and when a reply comes.
    void runUntil(Duration time) {
        while (true) {
            Time next = detector.wakeUpTime();
            for (const Reply& reply : replies) {
                next = std::min(next, reply.time);
            }
            if (next > start + time) {
                break;
            }
            now = std::max(now, next);
            wakeUp();
        }
        now = start + time;
    }

    void wakeUp() {
        detector.wakeUp(now);
        for (auto reply = replies.begin(); reply != replies.end();) {
            if (reply->time <= now) {
                detector.replyReceived(reply->probe);
                reply = replies.erase(reply);
            } else {
                ++reply;
            }
        }
        if (wasAlive && !detector.isPeerAlive() && died == Duration::max()) {
            died = now - start;
        }
        wasAlive = detector.isPeerAlive();
        ++wakeUps;
        if (!detector.isProbeDue()) {
            return;
        }
        if (sending == Sending::fails) {
            detector.probeNotSent();
            return;
        }
        probes.push_back(now - start);
        if (isReplying) {
            replies.push_back({now + roundTrip, detector.nextProbe()});
        }
        detector.probeSent();
    }

    struct Reply {
        Time time;
        std::size_t probe;
    };

    const Time start = Time(1000s);
    Time now = start;
    FailureDetector detector{1s, 3s, start};
    std::vector<Duration> probes;
    std::deque<Reply> replies;
    Duration roundTrip = 1ms;
    Duration died = Duration::max();
    bool isReplying = true;
    bool wasAlive = false;
    int wakeUps = 0;
    Sending sending = Sending::works;
};

TEST_F(FailureDetectorTest, PeerWithoutAReplyIsUnknownUntilTheTimeIsUp) {
    isReplying = false;
    runUntil(2999ms);
    EXPECT_FALSE(detector.isPeerAlive());
    EXPECT_FALSE(detector.isPeerDead());
    runUntil(3s);
    EXPECT_FALSE(detector.isPeerAlive());
    EXPECT_TRUE(detector.isPeerDead());
}

TEST_F(FailureDetectorTest, TimeInWhichTheProcessWasStoppedDoesNotCountBeforeTheFirstReply) {
    isReplying = false;
    runUntil(500ms);
    now += 60s;
    wakeUp();
    EXPECT_FALSE(detector.isPeerDead());
    runUntil(63100ms);
    EXPECT_TRUE(detector.isPeerDead());
}

TEST_F(FailureDetectorTest, UnsentProbesAreNotMissedBeforeTheFirstReply) {
    sending = Sending::fails;
    runUntil(100s);
    EXPECT_FALSE(detector.isPeerDead());
    sending = Sending::works;
    isReplying = false;
    runUntil(104s);
    EXPECT_TRUE(detector.isPeerDead());
}

TEST_F(FailureDetectorTest, LostFirstProbeIsFollowedByFrequentOnes) {
    isReplying = false;
    runUntil(1s);
    EXPECT_EQ(probes, (std::vector<Duration>{0s, 300ms, 450ms, 600ms, 750ms, 900ms}));
}

TEST_F(FailureDetectorTest, FirstReplyMakesThePeerAlive) {
    runUntil(2ms);
    EXPECT_TRUE(detector.isPeerAlive());
}

TEST_F(FailureDetectorTest, ProbesGoOutEveryCheckIntervalWhileRepliesCome) {
    runUntil(4500ms);
    EXPECT_EQ(probes, (std::vector<Duration>{0s, 1s, 2s, 3s, 4s}));
}

TEST_F(FailureDetectorTest, PeerIsDeadWhenDeadAfterHasPassedSinceTheLastProof) {
    runUntil(2500ms);
    isReplying = false;
    runUntil(10s);
    EXPECT_EQ(died, 5s);  // proven by the reply to the probe of 2 s
}

TEST_F(FailureDetectorTest, MissedProbeMakesProbesFrequentUntilTheTimeIsUp) {
    runUntil(500ms);
    isReplying = false;
    runUntil(2999ms);
    std::vector<Duration> expected = {0s, 1s};
    for (Duration time = 1300ms; time < 3s; time += 150ms) {
        expected.push_back(time);
    }
    EXPECT_EQ(probes, expected);
    runUntil(6s);
    EXPECT_EQ(probes.back() - probes[probes.size() - 2], 1s);
}

TEST_F(FailureDetectorTest, ReplyEndsTheFrequentProbes) {
    runUntil(500ms);
    isReplying = false;
    runUntil(1500ms);
    isReplying = true;
    runUntil(10s);
    EXPECT_EQ(died, Duration::max());
    EXPECT_EQ(probes.back() - probes[probes.size() - 2], 1s);
}

TEST_F(FailureDetectorTest, ReplyIsProofAsOfItsProbeNotItsArrival) {
    roundTrip = 900ms;
    runUntil(950ms);
    replies.clear();
    isReplying = false;
    runUntil(10s);
    EXPECT_EQ(died, 3s);
}

TEST_F(FailureDetectorTest, ReplyOlderThanDeadAfterIsIgnored) {
    runUntil(500ms);
    isReplying = false;
    runUntil(1100ms);
    const Time late = start + 4200ms;  // the probe was sent at 1 s
    replies.push_back({late, 1});
    runUntil(5s);
    EXPECT_EQ(died, 3s);
    EXPECT_FALSE(detector.isPeerAlive());
}

TEST_F(FailureDetectorTest, LateReplyWithinDeadAfterMakesThePeerAliveAgain) {
    runUntil(500ms);
    isReplying = false;
    runUntil(3500ms);
    EXPECT_EQ(died, 3s);
    replies.push_back({start + 3600ms, 1});
    runUntil(3700ms);
    EXPECT_TRUE(detector.isPeerAlive());
}

TEST_F(FailureDetectorTest, TimeInWhichTheProcessWasStoppedDoesNotCount) {
    runUntil(2500ms);
    now += 60s;
    wakeUp();
    EXPECT_TRUE(detector.isPeerAlive());
    isReplying = false;
    replies.clear();
    runUntil(80s);
    EXPECT_NE(died, Duration::max());
    EXPECT_LE(died, 66s);
}

TEST_F(FailureDetectorTest, ProbeInFlightDuringAStopIsNotMissed) {
    isReplying = false;
    runUntil(0s);
    replies.push_back({start + 1ms, 0});
    runUntil(2ms);
    runUntil(1s);  // the second probe goes out, and the process stops
    now += 5s;
    wakeUp();
    EXPECT_TRUE(detector.isPeerAlive());
    replies.push_back({now, 1});
    wakeUp();
    isReplying = true;
    runUntil(20s);
    EXPECT_EQ(died, Duration::max());
}

TEST_F(FailureDetectorTest, OrdinarySchedulingDelayDelaysNoDecision) {
    runUntil(500ms);
    isReplying = false;
    while (died == Duration::max()) {
        now = detector.wakeUpTime() + 50ms;
        wakeUp();
    }
    EXPECT_LE(died, 3100ms);
}

TEST_F(FailureDetectorTest, UnsentProbesAreNotMissed) {
    runUntil(2500ms);
    sending = Sending::fails;
    runUntil(100s);
    EXPECT_TRUE(detector.isPeerAlive());
    EXPECT_EQ(died, Duration::max());
    sending = Sending::works;
    isReplying = false;
    runUntil(110s);
    EXPECT_LE(died, 103s);
}

TEST_F(FailureDetectorTest, UnsentProbesJustBeforeTheTimeIsUpCauseNoExtraWakeUps) {
    runUntil(2500ms);
    isReplying = false;
    runUntil(4999ms);  // a millisecond is left
    now = start + 4999900us;
    wakeUp();
    sending = Sending::fails;
    detector.probeNotSent();
    wakeUps = 0;
    runUntil(6s);
    EXPECT_LE(wakeUps, 8);  // one for each attempt
    EXPECT_EQ(died, Duration::max());
}

TEST_F(FailureDetectorTest, UnsentProbeIsRetriedSoon) {
    sending = Sending::fails;
    runUntil(100ms);
    sending = Sending::works;
    runUntil(151ms);
    EXPECT_EQ(probes, (std::vector<Duration>{150ms}));
}

TEST_F(FailureDetectorTest, SlowLinkKeepsThePeerAlive) {
    roundTrip = 2s;
    runUntil(100s);
    EXPECT_EQ(died, Duration::max());
    EXPECT_TRUE(detector.isPeerAlive());
}

TEST(FailureDetectorCapacityTest, IsBoundedForAllSettings) {
    for (const Duration deadAfter : {Duration(200ms), Duration(3s), Duration(60s)}) {
        for (const Duration interval : {Duration(50ms), deadAfter / 3}) {
            EXPECT_LE(FailureDetector(interval, deadAfter, Time(0s)).capacity(), 150U);
        }
    }
}

}  // namespace
