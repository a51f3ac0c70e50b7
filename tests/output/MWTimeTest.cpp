#include "output/MWTime.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

#include "output/MWDateFormatter.h"
#include "support/FakeHost.h"

TEST(MWTime, ReadsThreeClocksAtOnce) {
    FakeHost host;
    host.clock = {
        .absoluteTicks = 11, .continuousTicks = 22, .wallSeconds = 978307200, .wallNanoseconds = 500000000};
    const auto time = MWTime::now();
    ASSERT_TRUE(time);
    EXPECT_EQ(time->machAbsoluteTime(), 11U);
    EXPECT_EQ(time->machContinuousTime(), 22U);
    EXPECT_EQ(time->wallTime(), 0.5);
    EXPECT_EQ(time->date().time_since_epoch(), std::chrono::milliseconds(978307200500));
    // Before the reference date the seconds are negative, the fraction still counts forward.
    EXPECT_EQ(MWTime({.wallSeconds = 0, .wallNanoseconds = 250000000}).date().time_since_epoch(),
              std::chrono::milliseconds(250));
    host.clockFails = true;
    EXPECT_FALSE(MWTime::now());

    EXPECT_EQ(MWTime::nanosecondsForTicks(24000000, {.numer = 125, .denom = 3}), 1000000000U);
    EXPECT_EQ(MWTime::nanosecondsForTicks(7, {.numer = 1, .denom = 0}), 0U);
    EXPECT_EQ(MWTime::nanosecondsForTicks(UINT64_MAX, {.numer = 2, .denom = 1}), UINT64_MAX - 1) << "wraps";
}

TEST(MWDateFormatter, WritesLocalTimeWithItsOffset) {
    const auto text = [](const char* zone, int64_t seconds, int64_t nanoseconds) {
        setenv("TZ", zone, 1);
        tzset();
        return MWDateFormatter(' ').stringFromDate(
            MWTime({.wallSeconds = seconds, .wallNanoseconds = nanoseconds}).date());
    };
    constexpr int64_t instant = 1709676429;  // 2024-03-05 22:07:09 UTC
    EXPECT_EQ(text("UTC0", instant, 4000000), "2024-03-05 22:07:09.004Z");
    EXPECT_EQ(text("NST-5:30", instant, 0), "2024-03-06 03:37:09.000+05:30");
    EXPECT_EQ(text("NST3:30", instant, 0), "2024-03-05 18:37:09.000-03:30");
    EXPECT_EQ(text("UTC0", instant, 999999000), "2024-03-05 22:07:10.000Z") << "rounding carries";
    unsetenv("TZ");
    tzset();
}
