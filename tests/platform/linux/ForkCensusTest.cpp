#include "platform/linux/ForkCensus.h"

#include <gtest/gtest.h>

TEST(ForkCensus, WhoeverHasAForkThatIsMeasuredIsNotAlone) {
    ForkCensus census;
    EXPECT_FALSE(census.isAlone(10)) << "nobody is known";
    for (int measurement = 0; measurement < 2; ++measurement) {
        census.begin();
        EXPECT_FALSE(census.isAlone(12)) << "nor is anything known of the last measurement";
        for (int32_t pid = 10; const uint64_t exec : {5, 6, 7, 5}) {
            census.add(pid++, exec);
        }
        census.add(12, 7);
        EXPECT_EQ(census.measured(), 4U) << "one was named twice";
        EXPECT_FALSE(census.isAlone(10));
        EXPECT_FALSE(census.isAlone(13));
        EXPECT_TRUE(census.isAlone(11));
        EXPECT_TRUE(census.isAlone(12));
        EXPECT_FALSE(census.isAlone(99)) << "was never added";
        if (measurement == 0) {
            census.addSaved();
        } else {
            census.add(14, 0);
        }
        EXPECT_FALSE(census.isAlone(12)) << "what was saved, or is not known, can be anybody's fork";
    }
}
