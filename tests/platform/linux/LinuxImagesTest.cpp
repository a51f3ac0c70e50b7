#include "platform/linux/LinuxImages.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <regex>
#include <sstream>

#include "platform/RecordedFile.h"
#include "platform/linux/AddressSpace.h"
#include "platform/linux/MWLinuxHost.h"
#include "support/WrittenPages.h"

namespace {

constexpr uint64_t kPage = 4096;

/// "PATH", then "  START+SIZE NAME" for each of its segments.
std::string listing(const std::string& smaps) {
    ShmemDevices devices;
    std::vector<procfs::Vma> texts = procfs::parseSmaps(smaps);
    const std::vector<BackedVma> vmas = backedVmas(texts, devices, -1);
    const LinuxImages found = imagesOfVmas(vmas);
    EXPECT_EQ(found.imageOfVma.size(), vmas.size());
    std::ostringstream text;
    text << std::hex;
    for (const LinuxImage& image : found.images) {
        text << image.path << '\n';
        EXPECT_EQ(image.baseAddress(), image.segments.front().start);
        for (const LinuxImage::Segment& segment : image.segments) {
            text << "  " << segment.start << '+' << segment.size << ' ' << segment.name << '\n';
        }
    }
    return text.str();
}

const std::string kImages =
    "/tmp/prog name\n"
    "  5652776d1000+1000 __TEXT\n"
    "  5652776d2000+1000 __TEXT\n"
    "  5652776d3000+1000 __TEXT\n"
    "  5652776d4000+1000 __DATA_CONST\n"
    "  5652776d5000+2000 __DATA\n"
    "  5652776d7000+14000 __DATA\n"
    "/usr/lib/libc.so.6\n"
    "  7f7546832000+26000 __TEXT\n"
    "  7f7546858000+156000 __TEXT\n"
    "  7f7546a01000+4000 __DATA_CONST\n"
    "  7f7546a05000+2000 __DATA\n"
    "  7f7546a07000+d000 __DATA\n";

// As Linux 6.18 writes it, for a program whose name holds a blank and that maps a data file. Without the
// flags, written pages tell the same.
TEST(LinuxImages, TellsSegmentsFromMappings) {
    const std::string recorded = recordedFile("images.smaps");
    EXPECT_EQ(listing(recorded), kImages);
    EXPECT_EQ(listing(std::regex_replace(recorded, std::regex("VmFlags.*\n"), "")), kImages);
}

TEST(LinuxImages, OnlyFilesWithPrivateCodeAreImages) {
    EXPECT_EQ(listing("1000-2000 r-xs 00000000 fe:00 1 /srv/code buffer\n"
                      "2000-3000 rw-s 00001000 fe:00 1 /srv/code buffer\n"
                      "3000-4000 r-xp 00000000 00:01 2 /memfd:jit (deleted)\n"
                      "4000-5000 r-xp 00000000 00:00 0\n"
                      "5000-6000 rw-p 00000000 fe:00 3 /srv/data\n"
                      "6000-7000 rw-p 00000000 00:00 0\n"),
              "");
}

// A library that was replaced while it was in use, its successor loaded twice, a hole, and what lies near a
// bss without being one.
TEST(LinuxImages, FilesAreToldApartByInode) {
    EXPECT_EQ(listing("1000-2000 r-xp 00000000 fe:00 1 /lib/x (deleted)\n"
                      "2000-3000 rw-p 00001000 fe:00 1 /lib/x (deleted)\n"
                      "3000-4000 r-xp 00000000 fe:00 2 /lib/x\n"
                      "4000-5000 ---p 00001000 fe:00 2 /lib/x\n"
                      "5000-6000 rw-p 00001000 fe:00 2 /lib/x\n"
                      "6000-7000 rw-p 00000000 00:00 0 [anon:named by the program]\n"
                      "7000-8000 rw-p 00000000 00:00 0\n"
                      "8000-9000 r-xp 00000000 fe:00 2 /lib/x\n"
                      "9000-a000 rw-p 00001000 fe:00 2 /lib/x\n"
                      "a000-b000 rw-p 00000000 00:00 0\n"
                      "b000-c000 rw-p 00000000 00:00 0\n"
                      "c000-d000 rwxp 00002000 fe:00 2 /lib/x\n"
                      "d000-e000 rw-p 00000000 00:00 0\n"),
              "/lib/x\n  1000+1000 __TEXT\n  2000+1000 __DATA\n"
              "/lib/x\n  3000+1000 __TEXT\n  5000+1000 __DATA\n  8000+1000 __TEXT\n  9000+1000 __DATA\n"
              "  a000+1000 __DATA\n  c000+1000 __DATA\n");
}

// All within one window of addresses. Each library's data is shown under a name of its own, so it may not be
// joined with another's.
TEST(LinuxImages, MemorySharedByForkIsAnObjectForEachImage) {
    const std::string counts =
        "Rss: 4 kB\nPss: 2 kB\nShared_Dirty: 4 kB\nAnonymous: 4 kB\nVmFlags: rd wr mr mw me ac \n";
    const ObjectIdentity identity("0dd6b3ac-0f4b-4c3c-8b0f-5f5f1f0a6d11");
    ShmemDevices devices;
    RegionNames names;
    ForkFamily family(77);
    WrittenPages pages;
    for (uint64_t address = 0x400000; address < 0x409000; address += kPage) {
        pages.pages[address] = {uint64_t{1} << 63U};
    }
    std::vector<procfs::Vma> vmas = procfs::parseSmaps(
        "400000-401000 r-xp 00000000 fe:00 1 /lib/x\nRss: 0 kB\n"
        "401000-402000 rw-p 00001000 fe:00 1 /lib/x\n" +
        counts + "402000-403000 rw-p 00000000 00:00 0\n" + counts +
        "404000-405000 r-xp 00000000 fe:00 2 /lib/y\nRss: 0 kB\n"
        "405000-406000 rw-p 00001000 fe:00 2 /lib/y\n" +
        counts + "406000-407000 rw-p 00000000 00:00 0\n" + counts + "408000-409000 rw-p 00000000 00:00 0\n" +
        counts);
    const AddressSpace space(backedVmas(vmas, devices, -1),
                             {.pid = 10, .startTime = 5, .family = [&]() -> ForkFamily& { return family; }},
                             pages, {identity, devices, names, kPage});
    const auto objectAt = [&](uint64_t address) {
        const AddressSpaceRegion* region = space.regionAtOrAbove(address);
        EXPECT_EQ(region->info.share_mode, SM_COW);
        return region->info.object_id_full;
    };
    for (const uint64_t ofX : {0x401000, 0x402000}) {
        for (const uint64_t other : {0x405000, 0x406000, 0x408000}) {
            EXPECT_NE(objectAt(ofX), objectAt(other)) << std::hex << ofX << " and " << other;
        }
    }
    EXPECT_NE(objectAt(0x406000), objectAt(0x408000)) << "what no library has";
}

int initialised[2 * kPage] = {1};
int zeroed[64 * kPage];
const char* const relocated[] = {"a", "b"};

TEST(LinuxImages, FindsTheSegmentsOfALiveProgram) {
    MWLinuxHost host;
    task_t task = 0;
    ASSERT_EQ(host.task_read_for_pid(getpid(), task), KERN_SUCCESS);
    const auto segmentOf = [&](const void* object) {
        const auto address = reinterpret_cast<uint64_t>(object);
        std::string found;
        host.forEachImage(task, [&](const MWImageDescription& image) {
            image.forEachSegment([&](const MWImageSegmentDescription& segment) {
                if (address - segment.start < segment.length) {
                    const std::string path = image.path();
                    found += path.substr(path.rfind('/') + 1) + " " + segment.name;
                }
            });
        });
        return found;
    };
    zeroed[32 * kPage] = initialised[0];
    EXPECT_EQ(segmentOf(reinterpret_cast<const void*>(&imagesOfVmas)), "platform_tests __TEXT");
    EXPECT_EQ(segmentOf("a constant"), "platform_tests __TEXT");
    EXPECT_EQ(segmentOf(static_cast<const void*>(relocated)), "platform_tests __DATA_CONST");
    EXPECT_EQ(segmentOf(&initialised[kPage]), "platform_tests __DATA");
    EXPECT_EQ(segmentOf(&zeroed[32 * kPage]), "platform_tests __DATA") << "bss";
    EXPECT_EQ(segmentOf(&task), "") << "the stack";
    host.task_release(task);
}

}  // namespace
