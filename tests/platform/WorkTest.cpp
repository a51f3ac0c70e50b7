#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <mutex>
#include <semaphore>
#include <vector>

#include "platform/MWInterruptSource.h"
#include "platform/MWInvariant.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWWorkQueue.h"
#include "support/FakeHost.h"

namespace {

TEST(WorkQueue, RunsEachItemOnceAndWaitsForAll) {
    const MWConcurrentQueue queue("test.queue", QOS_CLASS_USER_INITIATED);
    std::mutex mutex;
    std::vector<size_t> started;
    std::atomic<int> running = 0;
    queue.apply(500, [&](size_t index) {
        ++running;
        {
            const std::lock_guard lock(mutex);
            started.push_back(index);
        }
        --running;
    });
    EXPECT_EQ(running, 0);
    ASSERT_EQ(started.size(), 500U);
    std::sort(started.begin(), started.end());
    for (size_t i = 0; i < started.size(); ++i) {
        ASSERT_EQ(started[i], i);
    }
    queue.apply(0, [](size_t) { FAIL() << "there is no work"; });
}

TEST(InterruptSource, DeliversEachInterruptUntilItIsCancelled) {
    std::counting_semaphore<> delivered(0);
    MWInterruptSource source([&] { delivered.release(); });
    for (int interrupt = 0; interrupt < 3; ++interrupt) {
        ASSERT_EQ(kill(getpid(), SIGINT), 0);
        delivered.acquire();
    }
    source.cancel();
    EXPECT_FALSE(delivered.try_acquire());
    EXPECT_EXIT(raise(SIGINT), testing::KilledBySignal(SIGINT), "") << "the default action is back";
}

TEST(InterruptSource, AnInterruptThatArrivedBeforeItWasCancelledIsNotLeftToTheDefaultAction) {
    std::counting_semaphore<> entered(0);
    std::counting_semaphore<> leave(0);
    MWInterruptSource source([&] {
        entered.release();
        leave.acquire();
    });
    ASSERT_EQ(kill(getpid(), SIGINT), 0);
    entered.acquire();
    ASSERT_EQ(kill(getpid(), SIGINT), 0);
    leave.release(2);
    source.cancel();
    EXPECT_TRUE(entered.try_acquire()) << "it was delivered";
}

TEST(InterruptSource, WithoutDescriptorsItDeliversNothingAndEnds) {
    rlimit before = {};
    getrlimit(RLIMIT_NOFILE, &before);
    rlimit none = before;
    none.rlim_cur = 0;
    setrlimit(RLIMIT_NOFILE, &none);
    {
        MWInterruptSource source([] { FAIL(); });
    }
    setrlimit(RLIMIT_NOFILE, &before);
    EXPECT_EXIT(raise(SIGINT), testing::KilledBySignal(SIGINT), "");
}

TEST(Invariant, StopsTheProgramWithItsText) {
    EXPECT_DEATH(MW_INVARIANT(1 == 2, "one is not two"), "one is not two");
}

TEST(PhysMemweightSwitch, CachesTheHostsAnswerUntilItIsSet) {
    FakeHost host;
    host.selfRegionMemweight = 1;
    EXPECT_TRUE(MWPhysMemweightSwitch::isOn());
    EXPECT_TRUE(MWPhysMemweightSwitch::isOn());
    EXPECT_EQ(host.asked("sysctlSelfRegionMemweight"), 1);
    MWPhysMemweightSwitch::set(false);
    EXPECT_FALSE(MWPhysMemweightSwitch::isOn());
    EXPECT_EQ(host.selfRegionMemweight, 0);
}

TEST(PhysMemweightSwitch, OnlyAMissingControlIsSilent) {
    FakeHost host;
    const auto messages = [&](int error) {
        host.selfRegionMemweightError = error;
        testing::internal::CaptureStderr();
        MWPhysMemweightSwitch::set(true);
        EXPECT_FALSE(MWPhysMemweightSwitch::isOn());
        return testing::internal::GetCapturedStderr();
    };
    EXPECT_EQ(messages(ENOENT), "");
    EXPECT_EQ(messages(EPERM),
              "Unable to configure physical memweight data collection: Operation not permitted\n"
              "Unable to retrieve status of physical memweight data collection: Operation not permitted\n");
}

}  // namespace
