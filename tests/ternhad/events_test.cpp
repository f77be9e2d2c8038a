#include "events.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "support/sandbox.h"

namespace {

using ternhad::Events;
using ::testing::Each;
using ::testing::SizeIs;

// As ternhad writes after a disk hung.
class EventsTest : public test::SandboxTest {
 protected:
    void record(std::size_t count) {
        for (std::size_t i = 0; i < count; ++i) {
            events.log("some.cpp", 7, "happened");
        }
    }

    std::vector<std::string> written() {
        events.end();
        events.run();
        return test::daemonLogMessages();
    }

    Events events;
};

TEST_F(EventsTest, FullQueueLosesNothing) {
    record(256);
    const auto lines = written();
    EXPECT_THAT(lines, SizeIs(256));
    EXPECT_THAT(lines, Each("some.cpp:7 happened"));
}

TEST_F(EventsTest, LossesAreCounted) {
    record(256 + 44);
    auto lines = written();
    ASSERT_THAT(lines, SizeIs(257));
    EXPECT_THAT(lines.front(), test::LogLine("events.cpp", "Events lost: 44"));
    lines.erase(lines.begin());
    EXPECT_THAT(lines, Each("some.cpp:7 happened"));
}

TEST_F(EventsTest, LossesAreLoggedOnce) {
    record(257);
    EXPECT_THAT(written(), SizeIs(257));
    record(1);
    const auto lines = written();
    EXPECT_THAT(lines, SizeIs(258));
    EXPECT_EQ(lines.back(), "some.cpp:7 happened");
}

}  // namespace
