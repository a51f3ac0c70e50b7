#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <memory>
#include <mutex>
#include <numeric>
#include <semaphore>
#include <thread>
#include <vector>

#include "platform/MWInterruptSource.h"
#include "platform/MWInvariant.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWProgress.h"
#include "platform/MWWorkQueue.h"
#include "platform/linux/LinuxTimer.h"
#include "support/FakeHost.h"

namespace {

TEST(WorkQueue, RunsEachItemOnceAndWaitsForAll) {
    const FakeHost host;
    const MWConcurrentQueue queue("test.queue", QOS_CLASS_USER_INITIATED);
    std::vector<std::atomic<int>> runs(500);
    queue.apply(runs.size(), [&](size_t index) { ++runs[index]; });
    EXPECT_TRUE(std::all_of(runs.begin(), runs.end(), [](int count) { return count == 1; }));
    queue.apply(0, [](size_t) { FAIL() << "there is no work"; });
}

/// Its time passes while somebody waits and `passes` is set.
class QuickHost : public FakeHost {
public:
    std::atomic<bool> passes = false;

    void waitForChange(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                       uint64_t nanoseconds) override {
        FakeHost::waitForChange(lock, changed, passes ? nanoseconds / 1000 : nanoseconds);
        uptime += passes ? nanoseconds : 0;
    }
};

TEST(WorkQueue, GivesUpWhatMakesNoProgress) {
    constexpr size_t kItems = 40;
    struct Shared {
        std::atomic<size_t> ended = 0;
        std::atomic<bool> released = false;
        std::atomic<int> steps = 0;
    };
    QuickHost host;
    const auto shared = std::make_shared<Shared>();
    const MWConcurrentQueue queue("test.queue", QOS_CLASS_USER_INITIATED);
    // More of them than there are threads, and one that takes long but goes on.
    const size_t stuck = std::thread::hardware_concurrency() + 1;
    const auto givenUp = queue.apply(kItems, [&host, shared, stuck](size_t index) {
        if (index < stuck) {
            host.passes = true;
            shared->released.wait(false);
        } else if (index == stuck) {
            const uint64_t begin = host.uptime;
            while (host.uptime < begin + 3 * MWConcurrentQueue::patience) {
                MWProgress::mark();
                ++shared->steps;
                std::this_thread::yield();
            }
        }
        ++shared->ended;
    });
    std::vector<size_t> expected(stuck);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(givenUp, expected);
    EXPECT_EQ(shared->ended, kItems - stuck);
    EXPECT_GT(shared->steps, 0);
    EXPECT_TRUE(MWConcurrentQueue::hasGivenUp());
    shared->released = true;
    shared->released.notify_all();
    MWConcurrentQueue::awaitGivenUp();
    EXPECT_EQ(shared->ended, kItems) << "they end after all";
    EXPECT_FALSE(MWConcurrentQueue::hasGivenUp());
}

// A stopped program finds much time gone when it goes on.
TEST(WorkQueue, DoesNotTakeItsOwnStopForAnothers) {
    class StoppedHost : public FakeHost {
    public:
        std::binary_semaphore goOn = std::binary_semaphore(0);
        int waits = 0;

        void waitForChange(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                           uint64_t nanoseconds) override {
            constexpr int kLooks = 3;
            if (++waits <= kLooks) {
                uptime += 3 * MWConcurrentQueue::patience;
                return;
            }
            if (waits == kLooks + 1) {
                goOn.release();
            }
            FakeHost::waitForChange(lock, changed, nanoseconds);
        }
    };
    StoppedHost host;
    const MWConcurrentQueue queue("test.queue", QOS_CLASS_USER_INITIATED);
    EXPECT_TRUE(queue.apply(1, [&host](size_t) { host.goOn.acquire(); }).empty());
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
    uint64_t calls = 0;
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
    queue.sync([&] { EXPECT_LT(calls, total); });
    const uint64_t callsAtTheEnd = calls;
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
