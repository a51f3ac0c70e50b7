#include "platform/linux/ForkCensus.h"

#include <gtest/gtest.h>

TEST(ForkCensus, WhoeverHasAForkThatIsMeasuredIsNotAlone) {
    ForkCensus census;
    EXPECT_FALSE(census.isAlone(10)) << "nobody is known";
    for (int measurement = 0; measurement < 2; ++measurement) {
        census.begin();
        EXPECT_FALSE(census.isAlone(12)) << "nor is anything known of the last measurement";
        for (int32_t pid = 10; const uint64_t program : {5, 6, 7, 5, 0}) {
            census.add(pid++, program);
        }
        census.add(12, 7);
        EXPECT_EQ(census.measured(), 5U) << "one was named twice";
        EXPECT_FALSE(census.isAlone(10));
        EXPECT_FALSE(census.isAlone(13));
        EXPECT_TRUE(census.isAlone(11));
        EXPECT_TRUE(census.isAlone(12));
        EXPECT_FALSE(census.isAlone(14)) << "its program is not known";
        EXPECT_FALSE(census.isAlone(99)) << "was never added";
        census.addSaved();
        EXPECT_FALSE(census.isAlone(12)) << "what was saved can be anybody's fork";
        EXPECT_EQ(census.measured(), 5U);
    }
}
