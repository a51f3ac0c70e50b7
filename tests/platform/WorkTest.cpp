#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
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
    std::vector<std::atomic<int>> runs(500);
    queue.apply(runs.size(), [&](size_t index) { ++runs[index]; });
    EXPECT_TRUE(std::all_of(runs.begin(), runs.end(), [](int count) { return count == 1; }));
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
