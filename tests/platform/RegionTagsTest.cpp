#include "platform/linux/RegionTags.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <array>
#include <random>
#include <string>
#include <vector>

#include "platform/MWRegionTags.h"
#include "platform/linux/AddressSpace.h"

namespace {

// One mapping: the beginning of its line in smaps, its dirty kilobytes, the VmFlags that matter, the tag that
// it is to get, and its path.
struct Row {
    const char* mapping;
    unsigned dirty;
    const char* flags;
    uint32_t tag;
    const char* path = "";
};

std::string smapsOf(const Row& row) {
    const std::string path = row.path;
    const std::string device = path.starts_with('/') ? " 00000000 fe:00 9 " : " 00000000 00:00 0 ";
    return row.mapping + device + path + "\nPrivate_Dirty: " + std::to_string(row.dirty) +
           " kB\nVmFlags: mr mw me " + row.flags + "\n";
}

std::vector<BackedVma> backedVmas(const std::string& smaps) {
    ShmemDevices devices;
    std::vector<BackedVma> backed;
    for (procfs::Vma& vma : procfs::parseSmaps(smaps)) {
        const Backing backing = backingOf(vma, devices, -1);
        backed.push_back({std::move(vma), backing});
    }
    return backed;
}

std::vector<uint32_t> tagsOf(const std::vector<Row>& rows) {
    std::string smaps;
    for (const Row& row : rows) {
        smaps += smapsOf(row);
    }
    RegionNames names;
    const std::vector<BackedVma> vmas = backedVmas(smaps);
    return tagsForVmas(vmas, imagesOfVmas(vmas), names);
}

void expectTags(const std::vector<Row>& rows) {
    const std::vector<uint32_t> tags = tagsOf(rows);
    ASSERT_EQ(tags.size(), rows.size());
    for (size_t i = 0; i < rows.size(); ++i) {
        EXPECT_EQ(tags[i], rows[i].tag) << rows[i].mapping << ' ' << rows[i].path;
    }
}

// Mappings recorded from a process, less what repeats itself. Of the memory that no file accounts for, hardly
// any is left without a kind.
void expectRecorded(const std::vector<Row>& rows) {
    expectTags(rows);
    const std::vector<uint32_t> tags = tagsOf(rows);
    unsigned dirty = 0;
    unsigned untagged = 0;
    for (size_t i = 0; i < rows.size(); ++i) {
        dirty += rows[i].dirty;
        untagged += tags[i] == MWTagNone && *rows[i].path != '/' ? rows[i].dirty : 0;
    }
    EXPECT_LE(untagged * 20, dirty);
}

TEST(RegionTagsTest, Shell) {
    expectRecorded({
        {"55ea9bbaa000-55ea9bc6b000 r-xp", 0, "", MWTagNone, "/usr/bin/bash"},
        {"55ea9bca3000-55ea9bca7000 r--p", 16, "ac", MWTagNone, "/usr/bin/bash"},
        {"55ea9bca7000-55ea9bcb0000 rw-p", 36, "ac", MWTagNone, "/usr/bin/bash"},
        {"55ea9bcb0000-55ea9bcbb000 rw-p", 28, "ac", MWTagImageBss},
        {"55eaa1289000-55eaa1835000 rw-p", 5808, "ac", MWTagBrkHeap, "[heap]"},
        {"7f3c646f8000-7f3c646fb000 rw-p", 8, "ac", MWTagNone},
        {"7f3c6491b000-7f3c6491d000 rw-p", 8, "ac", MWTagNone},
        {"7f3c6491d000-7f3c64921000 r--p", 0, "dd", MWTagVvar, "[vvar]"},
        {"7f3c64921000-7f3c64923000 r--p", 0, "dd", MWTagVvarClock, "[vvar_vclock]"},
        {"7f3c64923000-7f3c64925000 r-xp", 0, "", MWTagVdso, "[vdso]"},
        {"7ffda8951000-7ffda8972000 rw-p", 16, "gd ac", MWTagMainStack, "[stack]"},
        {"ffffffffff600000-ffffffffff601000 --xp", 0, "", MWTagVsyscall, "[vsyscall]"},
    });
}

// Stack and next guard alternate; the arenas lie apart from them.
TEST(RegionTagsTest, ThreadsThatAllocate) {
    expectRecorded({
        {"55c2ec05b000-55c2ec05c000 r-xp", 0, "", MWTagNone, "/usr/bin/server"},
        {"55c2ec05e000-55c2ec05f000 rw-p", 4, "ac", MWTagNone, "/usr/bin/server"},
        {"55c2ec05f000-55c2ec15f000 rw-p", 1024, "ac", MWTagImageBss},
        {"55c306866000-55c307022000 rw-p", 7880, "ac", MWTagBrkHeap, "[heap]"},
        {"7f7b9c000000-7f7b9c7b2000 rw-p", 7880, "nr", MWTagMallocArena},
        {"7f7b9c7b2000-7f7ba0000000 ---p", 0, "nr", MWTagMallocReserve},
        {"7f7ba0000000-7f7ba07b2000 rw-p", 7880, "nr", MWTagMallocArena},
        {"7f7ba07b2000-7f7ba4000000 ---p", 0, "nr", MWTagMallocReserve},
        {"7f7ba6427000-7f7ba6428000 ---p", 0, "nh", MWTagStackGuard},
        {"7f7ba6428000-7f7ba6c28000 rw-p", 8, "ac nh", MWTagThreadStack},
        {"7f7ba6c28000-7f7ba6c29000 ---p", 0, "nh", MWTagStackGuard},
        {"7f7ba6c29000-7f7ba7429000 rw-p", 8, "ac nh", MWTagThreadStack},
        {"7f7ba7429000-7f7ba742c000 rw-p", 8, "ac", MWTagNone},
    });
}

TEST(RegionTagsTest, PythonWithThreads) {
    expectRecorded({
        {"55690ac48000-55690ac49000 r-xp", 0, "", MWTagNone, "/usr/bin/python3.11"},
        {"556926c1c000-556926dde000 rw-p", 1772, "ac", MWTagBrkHeap, "[heap]"},
        {"7f9f37aff000-7f9f38000000 rw-p", 5124, "ac", MWTagPythonHeap},
        {"7f9f38000000-7f9f38040000 rw-p", 248, "nr", MWTagMallocArena},
        {"7f9f38040000-7f9f3c000000 ---p", 0, "nr", MWTagMallocReserve},
        {"7f9f3c127000-7f9f3c327000 rw-p", 1476, "ac", MWTagPythonHeap},
        {"7f9f3e4ff000-7f9f3eeff000 rw-p", 10080, "ac", MWTagPythonHeap},
        {"7f9f3eeff000-7f9f3ef00000 ---p", 0, "nh", MWTagStackGuard},
        {"7f9f3ef00000-7f9f3f700000 rw-p", 8, "ac nh", MWTagThreadStack},
        {"7f9f3f700000-7f9f40000000 rw-p", 9216, "ac", MWTagPythonHeap},
        {"7f9f40000000-7f9f40040000 rw-p", 248, "nr", MWTagMallocArena},
        {"7f9f40040000-7f9f44000000 ---p", 0, "nr", MWTagMallocReserve},
        {"7f9f4dfc9000-7f9f4dfd5000 rw-p", 12, "ac", MWTagNone},
    });
}

TEST(RegionTagsTest, Java) {
    expectRecorded({
        {"e0000000-faf00000 rw-p", 309512, "ac", MWTagJavaHeap},
        {"faf00000-ffe00000 ---p", 0, "nr", MWTagReservedRange},
        {"ffe00000-ffe75000 rw-p", 316, "ac", MWTagNone, "/usr/lib/jvm/lib/server/classes.jsa"},
        {"ffe75000-fff00000 rw-p", 0, "ac", MWTagJavaHeap},
        {"56266b467000-56266b468000 r-xp", 0, "", MWTagNone, "/usr/lib/jvm/bin/java"},
        {"7f3580000000-7f358014a000 rw-p", 1320, "nr", MWTagMallocArena},
        {"7f358014a000-7f3584000000 ---p", 0, "nr", MWTagMallocReserve},
        {"7f359b400000-7f359b410000 rw-p", 24, "ac", MWTagJavaHeap},
        {"7f359b410000-7f359f000000 ---p", 0, "nr", MWTagReservedRange},
        {"7f35ed5ff000-7f35f0000000 rw-p", 10244, "ac", MWTagOffHeap},
        // Its threads protect the end of their stack themselves.
        {"7f35fc02a000-7f35fc02b000 ---p", 0, "nh", MWTagStackGuard},
        {"7f35fc02b000-7f35fc12b000 rw-p", 8, "ac nh", MWTagThreadStack},
        {"7f35fc22c000-7f35fc230000 ---p", 0, "", MWTagStackGuard},
        {"7f35fc230000-7f35fc32c000 rw-p", 96, "ac nh", MWTagThreadStack},
        // A stack that borders on code.
        {"7f35fd2ff000-7f35fd300000 ---p", 0, "nh", MWTagStackGuard},
        {"7f35fd300000-7f35fd400000 rw-p", 8, "ac nh", MWTagThreadStack},
        {"7f35fd400000-7f35fd670000 rwxp", 112, "ac", MWTagJitCode},
        {"7f35fd670000-7f3604938000 ---p", 0, "nr", MWTagReservedRange},
        {"7f36196dc000-7f36197c6000 rw-p", 92, "ac", MWTagOffHeap},
        {"7f36197c6000-7f36197ed000 ---p", 0, "nr", MWTagGuard},
        {"7f361a200000-7f361b1a4000 r-xp", 0, "", MWTagNone, "/usr/lib/jvm/lib/server/libjvm.so"},
        {"7f361b4dd000-7f361b512000 rw-p", 192, "ac", MWTagNone, "/usr/lib/jvm/lib/server/libjvm.so"},
        {"7f361b512000-7f361b56c000 rw-p", 316, "ac", MWTagImageBss},
        {"7f361b7a7000-7f361b7a8000 r--p", 4, "", MWTagReadOnly},
    });
}

TEST(RegionTagsTest, Node) {
    expectRecorded({
        {"b72000-25fe000 r-xp", 0, "", MWTagNone, "/usr/bin/node"},
        {"563e000-565d000 rw-p", 92, "ac", MWTagNone, "/usr/bin/node"},
        {"565d000-5689000 rw-p", 164, "ac", MWTagImageBss},
        {"22113000-22415000 rw-p", 2916, "ac", MWTagBrkHeap, "[heap]"},
        {"114d540000-114d580000 rw-p", 232, "nr", MWTagNodeHeap},
        {"13905140000-13905182000 rw-p", 264, "nr", MWTagNodeHeap},
        {"1532c5600000-1532c5640000 ---p", 0, "nr", MWTagGuard},
        {"3a26fb2c0000-3a26fb2cd000 r--p", 52, "nr", MWTagNodeHeap},
        {"7fbfec003000-7fbfec03f000 rwxp", 44, "nr", MWTagJitCode},
        {"7fbfec03f000-7fc00be40000 ---p", 0, "nr", MWTagReservedRange},
        {"7fc00c000000-7fc00c0da000 rw-p", 872, "nr", MWTagMallocArena},
        {"7fc00c0da000-7fc010000000 ---p", 0, "nr", MWTagMallocReserve},
        // A buffer outside the heap, below a code range by chance.
        {"7fc0217bf000-7fc021fc0000 rw-p", 8196, "ac", MWTagOffHeap},
        {"7fc021fc0000-7fc021fc2000 rw-p", 8, "nr", MWTagNodeHeap},
        {"7fc021fc2000-7fc021fc3000 ---p", 0, "nr", MWTagGuard},
        {"7fc021fc3000-7fc021fff000 rwxp", 20, "nr", MWTagJitCode},
        {"7fc0482bc000-7fc0482bd000 ---p", 0, "nh", MWTagStackGuard},
        {"7fc0482bd000-7fc0486bd000 rw-p", 36, "ac nh", MWTagThreadStack},
        {"7fc0486bd000-7fc0486c1000 rw-p", 0, "nr", MWTagNone},
        {"7fc0486c1000-7fc04873d000 ---p", 0, "nr", MWTagGuard},
    });
}

TEST(RegionTagsTest, OtherAllocators) {
    expectRecorded({
        {"562255705000-562255706000 r-xp", 0, "", MWTagNone, "/usr/bin/server"},
        {"7fda38000000-7fda3c200000 rw-p", 43148, "nr", MWTagJemalloc},
        {"7fda3cbff000-7fda3cc00000 ---p", 0, "nh", MWTagStackGuard},
        {"7fda3cc00000-7fda3d400000 rw-p", 12, "ac nh", MWTagThreadStack},
        {"7fda3d400000-7fda3e000000 rw-p", 4564, "nr", MWTagJemalloc},
        {"7fda40a00000-7fda40a90000 r-xp", 0, "", MWTagNone, "/usr/lib/libjemalloc.so.2"},
        {"7fda40ac8000-7fda40ace000 rw-p", 24, "ac", MWTagNone, "/usr/lib/libjemalloc.so.2"},
        {"7fda40ace000-7fda40ced000 rw-p", 40, "ac", MWTagImageBss},
        {"7fda40d47000-7fda40d4e000 rw-p", 28, "ac", MWTagNone},
    });
    expectRecorded({
        // The second has the shape of an arena and its reserve but for the end.
        {"278e2000000-278e4800000 rw-p", 16064, "nr", MWTagMimalloc},
        {"278e4800000-278e6000000 ---p", 0, "nr", MWTagReservedRange},
        {"278e8000000-278e8800000 rw-p", 8044, "nr", MWTagMimalloc},
        {"278e8800000-278ea000000 ---p", 0, "nr", MWTagReservedRange},
        {"7f6122fae000-7f6122fb8000 rw-p", 40, "nr", MWTagMimalloc},
        {"7f6122fb8000-7f6122fc8000 r-xp", 0, "", MWTagNone, "/usr/lib/libmimalloc.so.2"},
    });
    expectRecorded({
        {"7fff7000-8fff7000 rw-p", 0, "nr dd nh", MWTagSanitizerShadow},
        {"8fff7000-2008fff7000 ---p", 0, "nr", MWTagSanitizerShadow},
        {"2008fff7000-10007fff8000 rw-p", 7868, "nr dd nh", MWTagSanitizerShadow},
        {"61d000000000-61d003aa0000 rw-p", 60032, "ac", MWTagCommittedRange},
        {"61d003aa0000-61de00000000 ---p", 0, "nr", MWTagReservedRange},
        {"7f29bee00000-7f29bef00000 rw-p", 460, "ac", MWTagNone},
    });
}

TEST(RegionTagsTest, ArenasAreToldByTheirReserve) {
    expectTags({
        // Go takes its heap in steps of the same size; this is less than a step.
        {"c000000000-c000400000 rw-p", 4, "", MWTagNone},
        // Full heaps merged with the one after them, a full one alone; neither shape alone is enough.
        {"7f0000000000-7f0006000000 rw-p", 4, "nr", MWTagMallocArena},
        {"7f0006000000-7f0008000000 ---p", 0, "nr", MWTagMallocReserve},
        {"7f000c000000-7f0010000000 rw-p", 4, "nr", MWTagMallocArena},
        {"7f0014000000-7f0018000000 rw-p", 4, "ac", MWTagNone},
        {"7f001c000000-7f001d000000 rw-p", 4, "nr", MWTagNone},
    });
    expectTags({
        {"c000000000-c000400000 rw-p", 4, "ac", MWTagGoHeap},
        {"c000400000-c004000000 ---p", 0, "", MWTagReservedRange},
    });
}

TEST(RegionTagsTest, StacksOfKernelsThatDoNotMarkThem) {
    expectTags({
        {"7f0010000000-7f0010001000 ---p", 0, "", MWTagStackGuard},
        {"7f0010001000-7f0010801000 rw-p", 4, "ac", MWTagThreadStack},
        {"7f0010801000-7f0010802000 rw-p", 4, "ac", MWTagNone},
        // Merged with what was mapped above it; partitions between guards; a reservation used from its end.
        {"7f0020000000-7f0020001000 ---p", 0, "", MWTagGuard},
        {"7f0020001000-7f0020a05000 rw-p", 4, "ac", MWTagNone},
        {"7f0030000000-7f0030001000 ---p", 0, "nr", MWTagGuard},
        {"7f0030001000-7f0030101000 rw-p", 4, "nr", MWTagNone},
        {"7f0040000000-7f0050001000 ---p", 0, "", MWTagReservedRange},
        {"7f0050001000-7f0050101000 rw-p", 4, "ac", MWTagNone},
    });
    expectTags({
        // Where stacks are marked, nothing else is one.
        {"7f0010000000-7f0010001000 ---p", 0, "nh", MWTagStackGuard},
        {"7f0010001000-7f0010801000 rw-p", 4, "ac nh", MWTagThreadStack},
        {"7f0020000000-7f0020001000 ---p", 0, "", MWTagGuard},
        {"7f0020001000-7f0020801000 rw-p", 4, "ac", MWTagNone},
        {"7f0030000000-7f0030100000 rw-p", 4, "ac gd", MWTagGrowingStack},
        {"7f0040000000-7f0040100000 rw-p", 4, "ss", MWTagShadowStack},
    });
}

TEST(RegionTagsTest, CodeThatIsBeingWritten) {
    expectTags({
        {"7f939c000000-7f939c262000 rw-p", 4, "ac", MWTagNone},
        {"7f939c262000-7f939c272000 r-xp", 64, "ac", MWTagJitCode},
        {"7f939c272000-7f939c282000 rw-p", 64, "ac", MWTagJitCode},
        {"7f939c282000-7f939c292000 rwxp", 64, "ac", MWTagJitCode},
        {"7f939c292000-7f939c2a2000 rw-p", 64, "ac", MWTagNone},
    });
}

// Two owners of memory without a reservation, a debugger that embeds an interpreter, data that is no image.
TEST(RegionTagsTest, DoubtLeavesMemoryUntagged) {
    expectTags({
        {"b72000-25fe000 r-xp", 0, "", MWTagNone, "/usr/bin/node"},
        {"114d540000-114d580000 rw-p", 232, "nr", MWTagNone},
        {"7fda40a00000-7fda40a90000 r-xp", 0, "", MWTagNone, "/usr/lib/libjemalloc.so.2"},
    });
    expectTags({
        {"b72000-25fe000 r-xp", 0, "", MWTagNone, "/usr/bin/gdb"},
        {"7fda30000000-7fda34000000 rw-p", 4, "ac", MWTagNone},
        {"7fda40a00000-7fda40a90000 r-xp", 0, "", MWTagNone, "/usr/lib/libpython3.11.so.1.0"},
        {"7fda50a00000-7fda50a90000 rw-p", 4, "ac", MWTagNone, "/srv/table.bin"},
        {"7fda50a90000-7fda50a98000 rw-p", 4, "ac", MWTagNone},
    });
}

TEST(RegionTagsTest, PathsNameTheKind) {
    expectTags({
        {"001000-002000 rw-s", 4, "", MWTagAio, "/[aio] (deleted)"},
        {"002000-003000 rw-s", 4, "", MWTagIoUring, "anon_inode:[io_uring]"},
        {"003000-004000 rw-s", 4, "", MWTagPerf, "anon_inode:[perf_event]"},
        {"004000-005000 rw-s", 4, "", MWTagKvm, "anon_inode:kvm-vcpu:0"},
        {"005000-006000 rw-s", 4, "", MWTagVfio, "anon_inode:[vfio-device]"},
        {"006000-007000 rw-s", 4, "", MWTagAnonInode, "anon_inode:[else]"},
        {"007000-008000 r-xp", 4, "", MWTagUprobes, "[uprobes]"},
        {"008000-009000 rw-s", 4, "", MWTagDrm, "/dev/dri/renderD128"},
        {"009000-00a000 rw-s", 4, "", MWTagNvidia, "/dev/nvidia0"},
        {"00a000-00b000 rw-s", 4, "", MWTagPacketRing, "socket:[4711]"},
        {"00b000-00c000 rw-s", 4, "", MWTagPciDevice, "/sys/devices/pci0000:00/resource0"},
        {"00c000-00d000 rw-s", 4, "", MWTagMemfd, "/memfd:buffer (deleted)"},
        {"00d000-00e000 r-xs", 4, "", MWTagSharedCode, "/memfd:doublemapper (deleted)"},
        {"00e000-00f000 rw-s", 4, "", MWTagSysV, "/SYSV00000000 (deleted)"},
        {"010000-011000 rw-p", 4, "ht", MWTagHugetlb, "/anon_hugepage (deleted)"},
        {"011000-012000 rw-s", 4, "ht", MWTagHugetlbShared, "/anon_hugepage (deleted)"},
        {"012000-013000 rw-s", 4, "ht", MWTagHugetlbSysV, "/SYSV00000000 (deleted)"},
        {"013000-014000 rw-s", 4, "ht", MWTagHugetlbFile, "/mnt/huge/pool"},
        {"014000-015000 rw-p", 4, "", MWTagThreadStack, "[anon: glibc: pthread stack: 4711]"},
        {"015000-016000 rw-p", 4, "", MWTagMallocArena, "[anon: glibc: malloc arena]"},
        {"016000-017000 rw-p", 4, "", MWTagFirstDynamic, "[anon:Frames]"},
    });
}

// Whatever stands beside whatever: each mapping gets one tag.
TEST(RegionTagsTest, AnySequenceOfMappingsIsTagged) {
    std::mt19937 random(20);
    const auto pick = [&](const auto& choices) { return choices[random() % std::size(choices)]; };
    const char* const permissions[] = {"---p", "rw-p", "r--p", "r-xp", "rwxp", "rw-s"};
    const char* const paths[] = {"", "", "", "", "/usr/bin/node", "/usr/lib/libjvm.so", "[heap]", "[anon:x]"};
    const char* const flags[] = {"", "ac", "nr", "nh ac", "ht", "gd"};
    const uint64_t sizes[] = {0x1000, 0x40000, 0x2000000, 0x4000000};
    for (int round = 0; round < 300; ++round) {
        uint64_t at = pick(std::to_array<uint64_t>({0x1000, 0x7fff7000, 0xc000000000, 0x7f0000000000}));
        std::string smaps;
        const size_t count = 1 + random() % 30;
        for (size_t i = 0; i < count; ++i) {
            const uint64_t start = at + random() % 2 * pick(sizes);
            at = start + pick(sizes);
            const std::string mapping = fmt::format("{:x}-{:x} {}", start, at, pick(permissions));
            smaps += smapsOf({mapping.c_str(), 4, pick(flags), MWTagNone, pick(paths)});
        }
        RegionNames names;
        const std::vector<BackedVma> vmas = backedVmas(smaps);
        const std::vector<uint32_t> tags = tagsForVmas(vmas, imagesOfVmas(vmas), names);
        ASSERT_EQ(tags.size(), count);
        for (const uint32_t tag : tags) {
            EXPECT_LE(tag, MWTagLastDynamic) << smaps;
        }
    }
}

}  // namespace
