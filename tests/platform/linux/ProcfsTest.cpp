#include "platform/linux/Procfs.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <vector>

#include "platform/linux/SmapsParser.h"
#include "support/RecordedTree.h"

namespace {

class ProcfsTest : public RecordedTree {
protected:
    void SetUp() override {
        RecordedTree::SetUp();
        _directory = directory("");
    }
    procfs::Descriptor _directory;
};

TEST_F(ProcfsTest, RecordsAreReadWhole) {
    std::string text = "what was read before";
    for (const size_t size : {0U, 1U, 4095U, 4096U, 4097U, 8192U, 20000U}) {
        std::string written;
        while (written.size() < size) {
            written += fmt::format("{}\n", written.size());
        }
        written.resize(size);
        write("record", written);
        ASSERT_TRUE(procfs::readRecord(_directory.get(), "record", text));
        EXPECT_EQ(text, written) << size;
    }
    struct Failure {
        const char* path;
        int code;
    };
    for (const Failure& failure : {Failure{"none", ENOENT}, Failure{".", EISDIR}}) {
        text = "what was read before";
        errno = 0;
        EXPECT_FALSE(procfs::readRecord(_directory.get(), failure.path, text));
        EXPECT_EQ(errno, failure.code);
        EXPECT_EQ(text, "");
    }
}

// Longer than a read, and than what there is room for at first.
TEST_F(ProcfsTest, MappingsAreReadWholeHoweverMany) {
    constexpr uint64_t kCount = 70000;
    std::string text = "00001000-00000fff rw-p 00000000 00:00 0 ends before it starts\n";
    for (uint64_t index = 0; index < kCount; ++index) {
        const uint64_t start = 0x10000 + index * 0x2000;
        const char* suffix = index % 7 == 0 ? " (deleted)" : "";
        text += fmt::format("{:x}-{:x} r--p {:08x} 08:00 {:<20} /lib/\\012{}{}\n", start, start + 0x1000,
                            index * 0x1000, index, index, suffix);
        text += index % 1000 == 5 ? "zzzz\n7000-8000 rw-p 0 0:0 0 below\nffffffffffffffffff-0 rw-p\n" : "";
    }
    text.pop_back();
    write("maps", text);
    std::vector<procfs::Vma> vmas(3);
    vmas.front().path = "what was read before";
    ASSERT_TRUE(procfs::readMappings(_directory.get(), "maps", vmas));
    ASSERT_EQ(vmas.size(), kCount);
    for (uint64_t index = 0; index < kCount; ++index) {
        procfs::Vma expected;
        expected.start = 0x10000 + index * 0x2000;
        expected.end = expected.start + 0x1000;
        expected.offset = index * 0x1000;
        expected.inode = index;
        expected.deviceMajor = 8;
        expected.readable = true;
        expected.deleted = index % 7 == 0;
        expected.path = "/lib/\n" + std::to_string(index);
        ASSERT_TRUE(vmas[index] == expected) << vmas[index].path;
    }
    for (const char* path : {"none", "."}) {
        errno = 0;
        EXPECT_FALSE(procfs::readMappings(_directory.get(), path, vmas));
        EXPECT_NE(errno, 0);
    }
}

}  // namespace
