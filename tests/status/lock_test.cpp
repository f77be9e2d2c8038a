#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <functional>
#include <future>
#include <thread>

#include "faults/clock.h"
#include "status.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using namespace TERN::HA::Daemon;

Json::Value disks(const char* name) {
    Json::Value array(Json::arrayValue);
    array.append(name);
    return array;
}

// Holds a mutex in another thread for the lifetime of the object.
class Holder {
 public:
    explicit Holder(std::timed_mutex& mutex) {
        std::promise<void> held;
        _thread = std::thread([&mutex, &held, this] {
            const std::lock_guard<std::timed_mutex> lock(mutex);
            held.set_value();
            _release.get_future().wait();
        });
        held.get_future().wait();
    }

    ~Holder() {
        _release.set_value();
        _thread.join();
    }

 private:
    std::promise<void> _release;
    std::thread _thread;
};

class StatusLockTest : public test::SandboxTest {
 protected:
    StatusLockTest() {
        status.setErrHandlingDisk(disks("sda"));
        status.setErrHandlingDiskRemote(disks("sdb"));
    }

    // The operation waits five seconds for `mutex`, proceeds, and leaves the mutex to its holder.
    void expectToProceed(std::timed_mutex& mutex, const std::function<void()>& operation) {
        {
            const Holder holder(mutex);
            const test::Stopwatch stopwatch;
            operation();
            EXPECT_GE(stopwatch.elapsed(), 5s);
            EXPECT_LT(stopwatch.elapsed(), 10s);
            EXPECT_FALSE(mutex.try_lock());
        }
        EXPECT_TRUE(mutex.try_lock());
        mutex.unlock();
    }

    Status status;
};

TEST_F(StatusLockTest, GetDisksProceedsWithoutTheLock) {
    expectToProceed(status.errHandlingDiskMutex,
                    [&] { EXPECT_EQ(status.getErrHandlingDisk(), disks("sda")); });
}

TEST_F(StatusLockTest, SetDisksProceedsWithoutTheLock) {
    expectToProceed(status.errHandlingDiskMutex,
                    [&] { EXPECT_TRUE(status.setErrHandlingDisk(disks("sdx"))); });
    EXPECT_EQ(status.getErrHandlingDisk(), disks("sdx"));
}

TEST_F(StatusLockTest, WaitLastsAsLongAsItsTimeout) {
    status.lockTimeout = 1;
    const Holder holder(status.errHandlingDiskMutex);
    const test::Stopwatch stopwatch;
    EXPECT_EQ(status.getErrHandlingDisk(), disks("sda"));
    EXPECT_GE(stopwatch.elapsed(), 1s);
    EXPECT_LT(stopwatch.elapsed(), 4s);
}

TEST_F(StatusLockTest, WaitIsUnaffectedByAForwardClockStep) {
    test::stepClockAfterNextRead(1h);
    expectToProceed(status.errHandlingDiskMutex,
                    [&] { EXPECT_EQ(status.getErrHandlingDisk(), disks("sda")); });
}

// The thread sanitizer's mutexes wait on the wall clock, see cmake/thread_sanitizer.h.
#ifdef _GLIBCXX_USE_PTHREAD_MUTEX_CLOCKLOCK
TEST_F(StatusLockTest, WaitIsUnaffectedByABackwardClockStep) {
    test::stepClockAfterNextRead(-1h);
    expectToProceed(status.errHandlingDiskMutex,
                    [&] { EXPECT_EQ(status.getErrHandlingDisk(), disks("sda")); });
}
#endif

TEST_F(StatusLockTest, WaitIsFiveSeconds) {
    EXPECT_EQ(status.lockTimeout, 5);
}

TEST_F(StatusLockTest, GetPeerDisksProceedsWithoutTheLock) {
    expectToProceed(status.errHandlingDiskRemoteMutex,
                    [&] { EXPECT_EQ(status.getErrHandlingDiskRemote(), disks("sdb")); });
}

TEST_F(StatusLockTest, SetPeerDisksProceedsWithoutTheLock) {
    expectToProceed(status.errHandlingDiskRemoteMutex,
                    [&] { EXPECT_TRUE(status.setErrHandlingDiskRemote(disks("sdx"))); });
    EXPECT_EQ(status.getErrHandlingDiskRemote(), disks("sdx"));
}

TEST_F(StatusLockTest, AddStateProceedsWithoutTheLock) {
    expectToProceed(status.remoteNodeStateMutex,
                    [&] { EXPECT_TRUE(status.addRemoteNodeState(NodeRebooting)); });
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

TEST_F(StatusLockTest, DelStateProceedsWithoutTheLock) {
    status.addRemoteNodeState(NodeAlive | NodeRebooting);
    expectToProceed(status.remoteNodeStateMutex, [&] { EXPECT_TRUE(status.delRemoteNodeState(NodeAlive)); });
    EXPECT_EQ(status.getRemoteNodeState(), NodeRebooting);
}

TEST_F(StatusLockTest, SetAliveProceedsWithoutTheLock) {
    expectToProceed(status.remoteNodeStateMutex, [&] { EXPECT_TRUE(status.setRemoteAlive(true)); });
    EXPECT_TRUE(status.isRemoteAlive());
}

TEST_F(StatusLockTest, SetDeadProceedsWithoutTheLock) {
    status.setRemoteAlive(true);
    expectToProceed(status.remoteNodeStateMutex, [&] { EXPECT_TRUE(status.setRemoteAlive(false)); });
    EXPECT_FALSE(status.isRemoteAlive());
}

TEST_F(StatusLockTest, ClearingRebootingWaitsForEachBit) {
    status.addRemoteNodeState(NodeRebooting);
    const Holder holder(status.remoteNodeStateMutex);
    const test::Stopwatch stopwatch;
    status.setRemoteAlive(true);
    EXPECT_GE(stopwatch.elapsed(), 10s);
    EXPECT_LT(stopwatch.elapsed(), 15s);
    EXPECT_EQ(status.getRemoteNodeState(), NodeAlive);
}

TEST_F(StatusLockTest, ToJsonProceedsWithoutTheLock) {
    expectToProceed(status.errHandlingDiskMutex, [&] { EXPECT_EQ(status.toJson().size(), 10U); });
}

TEST_F(StatusLockTest, ToJsonWaitsForEachDiskList) {
    const Holder own(status.errHandlingDiskMutex);
    const Holder remote(status.errHandlingDiskRemoteMutex);
    const test::Stopwatch stopwatch;
    const Json::Value json = status.toJson();
    EXPECT_GE(stopwatch.elapsed(), 10s);
    EXPECT_LT(stopwatch.elapsed(), 15s);
    EXPECT_EQ(json["diskErrorHandlingDisk"], disks("sda"));
    EXPECT_EQ(json["diskErrorHandlingDiskRemote"], disks("sdb"));
}

TEST_F(StatusLockTest, ReadingTheStateDoesNotLock) {
    const Holder holder(status.remoteNodeStateMutex);
    const test::Stopwatch stopwatch;
    EXPECT_FALSE(status.isRemoteAlive());
    EXPECT_FALSE(status.isRemoteRebooting());
    EXPECT_EQ(status.getRemoteNodeState(), 0U);
    EXPECT_LT(stopwatch.elapsed(), 4s);
}

TEST_F(StatusLockTest, MutexesAreIndependent) {
    const Holder holder(status.errHandlingDiskMutex);
    const test::Stopwatch stopwatch;
    status.setErrHandlingDiskRemote(disks("sdc"));
    status.addRemoteNodeState(NodeAlive);
    EXPECT_LT(stopwatch.elapsed(), 4s);
}

}  // namespace
