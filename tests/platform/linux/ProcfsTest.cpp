#include "platform/linux/Procfs.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/linux/SmapsParser.h"
#include "support/RecordedTree.h"

namespace {

using ProcfsTest = RecordedTree;

TEST_F(ProcfsTest, RecordsAreReadWhole) {
    const procfs::Descriptor top = directory("");
    std::string text = "what was read before";
    for (const size_t size : {0U, 1U, 4095U, 4096U, 4097U, 8192U, 20000U}) {
        const std::string written(size, 'x');
        write("record", written);
        ASSERT_TRUE(procfs::readRecord(top.get(), "record", text));
        EXPECT_EQ(text, written) << size;
    }
    for (const auto& [path, code] : {std::pair("none", ENOENT), {".", EISDIR}}) {
        text = "what was read before";
        EXPECT_FALSE(procfs::readRecord(top.get(), path, text));
        EXPECT_EQ(errno, code);
        EXPECT_EQ(text, "");
    }
}

// Longer than a read, and than what there is room for at first.
TEST_F(ProcfsTest, MappingsAreReadWholeHoweverMany) {
    constexpr uint64_t kCount = 70000;
    const auto startOf = [](uint64_t index) { return 0x10000 + index * 0x2000; };
    std::string text = "1000-fff rw-p 00000000 00:00 0 ends before it starts\n";
    for (uint64_t index = 0; index < kCount; ++index) {
        text += fmt::format("{:x}-{:x} r--p {:x} 08:00 {:<20} /lib/\\012{} (deleted)\n", startOf(index),
                            startOf(index) + 0x1000, index, index, index);
        text += index % 1000 == 5 ? "zz\n7000-8000 rw-p 0 0:0 0 below\nffffffffffffffffff-0 rw-p\n" : "";
    }
    text.pop_back();
    write("maps", text);
    const procfs::Descriptor top = directory("");
    std::vector<procfs::Vma> vmas(3);
    ASSERT_TRUE(procfs::readMappings(top.get(), "maps", vmas));
    ASSERT_EQ(vmas.size(), kCount);
    for (uint64_t index = 0; index < kCount; ++index) {
        procfs::Vma expected;
        expected.start = startOf(index);
        expected.end = expected.start + 0x1000;
        expected.offset = expected.inode = index;
        expected.deviceMajor = 8;
        expected.readable = expected.deleted = true;
        expected.path = "/lib/\n" + std::to_string(index);
        ASSERT_TRUE(vmas[index] == expected) << vmas[index].path;
    }
    EXPECT_FALSE(procfs::readMappings(top.get(), "none", vmas));
    EXPECT_FALSE(procfs::readMappings(top.get(), ".", vmas)) << "what cannot be read is not empty";
}

}  // namespace
