#include "platform/linux/ForkCensus.h"

#include <gtest/gtest.h>

#include <string>

#include "support/RecordedTree.h"

namespace {

class ForkCensusTest : public RecordedTree {
protected:
    void SetUp() override {
        RecordedTree::SetUp();
        _proc = directory("");
    }
    uint64_t programOf(const std::string& auxv) const { return _identity.bytes(auxv); }
    void writeThread(const std::string& path, char state, const std::string& auxv) {
        write(path + "/auxv", auxv);
        const std::string number = path.substr(path.rfind('/') + 1);
        write(path + "/stat",
              number + " (x) " + state + " 1 1 1 0 -1 0 0 0 0 0 0 0 0 0 20 0 2 0 500 0 0 0 1 2 3 0 0\n");
    }

    procfs::Descriptor _proc;
    ObjectIdentity _identity{"boot"};
};

TEST_F(ForkCensusTest, WhoeverHasAForkIsNotAlone) {
    // Not measured: another process of one program, a kernel thread, one that lives in its second thread.
    writeThread("30", 'S', "forked");
    writeThread("2", 'S', "");
    writeThread("40", 'Z', "");
    writeThread("40/task/40", 'Z', "");
    writeThread("40/task/41", 'S', "without its first thread");
    for (const char* noProcess : {"12x", "self", "0x0c"}) {
        writeThread(noProcess, 'S', "alone");
    }
    ForkCensus census(_proc.get(), _identity);
    census.begin();
    const char* const measured[] = {"twice", "forked", "alone", "twice", "without its first thread"};
    for (int32_t pid = 10; const char* auxv : measured) {
        writeThread(std::to_string(pid), 'S', auxv);
        census.add(pid++, programOf(auxv));
    }
    census.add(15, 0);
    EXPECT_EQ(census.measured(), 6U);
    EXPECT_FALSE(census.isAlone(10)) << "two are measured";
    EXPECT_FALSE(census.isAlone(13));
    EXPECT_FALSE(census.isAlone(11)) << "one is not";
    EXPECT_TRUE(census.isAlone(12));
    EXPECT_FALSE(census.isAlone(14)) << "another thread of 40 has the memory";
    EXPECT_FALSE(census.isAlone(15)) << "nobody knows";
    EXPECT_FALSE(census.isAlone(99)) << "was never added";
    EXPECT_EQ(census.measured(), 6U) << "those that were only looked at are not measured";
}

TEST_F(ForkCensusTest, HoldsForOneMeasurement) {
    writeThread("10", 'S', "a");
    ForkCensus census(_proc.get(), _identity);
    for (int measurement = 0; measurement < 2; ++measurement) {
        census.begin();
        census.add(10, programOf("a"));
        census.add(10, programOf("a"));
        census.add(20, 0);
        EXPECT_TRUE(census.isAlone(10)) << "though it was named twice";
        EXPECT_FALSE(census.isAlone(20)) << "the only one of whom nothing is known";
    }
    writeThread("11", 'S', "a");
    EXPECT_TRUE(census.isAlone(10)) << "a child that was forked since is not measured";
    census.begin();
    EXPECT_FALSE(census.isAlone(10)) << "nor is anything known of the last measurement";
    census.add(10, programOf("a"));
    EXPECT_EQ(census.measured(), 1U);
    EXPECT_FALSE(census.isAlone(10));
}

}  // namespace
