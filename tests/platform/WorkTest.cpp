#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <memory>
#include <semaphore>
#include <vector>

#include "platform/MWInterruptSource.h"
#include "platform/MWInvariant.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWWorkQueue.h"
#include "platform/linux/LinuxTimer.h"
#include "support/FakeHost.h"

namespace {

TEST(WorkQueue, RunsEachItemOnceAndWaitsForAll) {
    const MWConcurrentQueue queue("test.queue", QOS_CLASS_USER_INITIATED);
    std::vector<std::atomic<int>> runs(500);
    queue.apply(runs.size(), [&](size_t index) { ++runs[index]; });
    EXPECT_TRUE(std::all_of(runs.begin(), runs.end(), [](int count) { return count == 1; }));
    queue.apply(0, [](size_t) { FAIL() << "there is no work"; });
}

TEST(SerialQueue, RunsItemsInOrderAndAllOfThem) {
    std::vector<int> order;
    std::binary_semaphore goOn(0);
    {
        MWSerialQueue queue("test.serial", QOS_CLASS_UTILITY);
        queue.async([&] { goOn.acquire(); });
        for (int item = 0; item < 100; ++item) {
            queue.async([&order, item] { order.push_back(item); });
        }
        EXPECT_GE(queue.waiting(), 100U);
        goOn.release();
        queue.sync([&] { EXPECT_EQ(order.size(), 100U); });
        queue.async([&order] { order.push_back(100); });
    }
    EXPECT_EQ(order.size(), 101U) << "its end waits for what is queued";
    EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(SerialQueue, AnItemIsDestroyedBeforeTheNextOneIsWaitedFor) {
    MWSerialQueue queue("test.serial", QOS_CLASS_UTILITY);
    const auto held = std::make_shared<int>(1);
    queue.async([held] {});
    queue.sync([] {});
    EXPECT_EQ(held.use_count(), 1);
}

TEST(LinuxTimer, CountsTheFiresThatComeWhileTheHandlerRuns) {
    constexpr uint64_t kMillisecond = 1'000'000;
    constexpr uint64_t kFires = 20;
    uint64_t total = 0;
    int calls = 0;
    std::binary_semaphore goOn(0);
    std::binary_semaphore allCame(0);
    MWSerialQueue queue("test.timer", QOS_CLASS_USER_INITIATED);
    const auto timer = LinuxTimer::create(queue, [&](uint64_t fires) {
        if (++calls == 1) {
            goOn.acquire();
        }
        const bool wereMissing = total < kFires;
        total += fires;
        if (wereMissing && total >= kFires) {
            allCame.release();
        }
    });
    ASSERT_NE(timer, nullptr);
    timer->arm({.firstAfter = 0, .interval = kMillisecond, .leeway = 0});
    // A second timer tells when the first one has fired so often.
    std::binary_semaphore enough(0);
    MWSerialQueue otherQueue("test.other", QOS_CLASS_USER_INITIATED);
    const auto other = LinuxTimer::create(otherQueue, [&](uint64_t) { enough.release(); });
    other->arm({.firstAfter = kFires * kMillisecond, .interval = 1000 * kMillisecond, .leeway = 0});
    enough.acquire();
    goOn.release();
    allCame.acquire();
    timer->cancel();
    queue.sync([&] { EXPECT_LT(calls, 10); });
    const int callsAtTheEnd = calls;
    queue.sync([&] { EXPECT_EQ(calls, callsAtTheEnd); });
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
