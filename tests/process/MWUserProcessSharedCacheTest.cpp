#include <fmt/core.h>
#include <gtest/gtest.h>

#include <vector>

#include "process/InspectedProcess.h"

namespace {

using Queries = std::vector<std::pair<uint64_t, uint64_t>>;  // start, pages

constexpr uint64_t kCache = 0x180000000;  // of a 64-bit process
const std::string kGap = "unused rtld shared cache area|-";

/// A process, 7, with shared-cache mappings whose starts, and those of the image segments, count from the
/// start of the cache.
struct World {
    FakeHost host;

    explicit World(std::vector<FakeRegion> mappings, std::vector<MWImageSegmentDescription> segments,
                   uint64_t pageSize = 4096) {
        host.sharedCache = true;
        host.pageSize = pageSize;
        // Mappings of the cache are told by the region below it.
        std::vector<FakeRegion> regions = {{.start = kCache - 0x1000000, .size = pageSize}};
        for (FakeRegion& mapping : mappings) {
            mapping.start += kCache;
            mapping.info = {.offset = mapping.start, .user_wired_count = 1};
            regions.push_back(std::move(mapping));
        }
        for (MWImageSegmentDescription& segment : segments) {
            segment.start += kCache;
        }
        host.processes[7] = {
            .comm = "victim",
            .regions = std::move(regions),
            .images = {{.path = "/lib/a", .baseAddress = kCache, .segments = std::move(segments)}}};
    }

    /// "START-END NAME|DETAIL KIND DIRTY+SWAPPED", all but the kind in hexadecimal, of each piece.
    Lines pieces() {
        const auto process = InspectedProcess::of(7);
        process->gatherData();
        EXPECT_EQ(process->errors(), Lines());
        Lines lines;
        for (const auto& region : *process->memoryRegions()) {
            if (region->inSharedCache()) {
                lines.push_back(fmt::format("{:x}-{:x} {}|{} {} {:x}+{:x}", region->start() - kCache,
                                            region->end() - kCache, region->name(),
                                            region->detailedName().value_or("-"), region->segment(),
                                            region->dirtySize(), region->swappedSize()));
                EXPECT_EQ(region->offset(), region->start()) << "the place in the object stays";
                EXPECT_EQ(region->object_id(), 1);
                EXPECT_TRUE(region->wired());
                const bool isGap = lines.back().find(kGap) != std::string::npos;
                EXPECT_EQ(region->unusedSharedCacheRegion(), isGap) << lines.back();
            }
        }
        return lines;
    }
};

TEST(MWUserProcessSharedCacheTest, CutsMappingAtImages) {
    struct Case {
        std::vector<MWImageSegmentDescription> segments;
        Lines pieces;
    };
    const std::vector<Case> cases = {
        {{}, {"0-10000 " + kGap + " 0 0+0"}},
        // The end goes up to whole units, with no image behind it.
        {{{"__DATA", 0x1000, 0x2800}},
         {"0-1000 " + kGap + " 3 0+0", "1000-4000 __DATA|/lib/a 3 0+0", "4000-10000 " + kGap + " 0 0+0"}},
        // It stays where the piece begins within a unit, and where the next image does.
        {{{"__DATA", 0x800, 0xC00}, {"__OTHER", 0x2000, 0x400}, {"__THIRD", 0x2800, 0xD800}},
         {"0-800 " + kGap + " 3 0+0", "800-1400 __DATA|/lib/a 3 0+0", "1400-2000 " + kGap + " 3 0+0",
          "2000-2400 __OTHER|/lib/a 3 0+0", "2400-2800 " + kGap + " 3 0+0",
          "2800-10000 __THIRD|/lib/a 3 0+0"}},
        // Images that lie over one another, are empty, or begin before and end behind the mapping.
        {{{"__BEFORE", static_cast<uint64_t>(-0x1000), 0x3800},
          {"__INSIDE", 0x2000, 0xC00},
          {"__EMPTY", 0x5000, 0},
          {"__BEHIND", 0xF000, 0x9000}},
         {"0-3000 __BEFORE|/lib/a 3 0+0", "3000-5000 " + kGap + " 3 0+0", "5000-f000 " + kGap + " 3 0+0",
          "f000-10000 __BEHIND|/lib/a 3 0+0"}},
    };
    for (const Case& c : cases) {
        World world({{.size = 0x10000}}, c.segments);
        EXPECT_EQ(world.pieces(), c.pieces);
    }
}

TEST(MWUserProcessSharedCacheTest, ImageGoesOnInTheNextMapping) {
    World world({{.size = 0x4000}, {.start = 0x4000, .size = 0x4000}}, {{"__DATA", 0x1000, 0x4800}});
    EXPECT_EQ(world.pieces(), (Lines{"0-1000 " + kGap + " 3 0+0", "1000-4000 __DATA|/lib/a 3 0+0",
                                     "4000-6000 __DATA|/lib/a 3 0+0", "6000-8000 " + kGap + " 0 0+0"}));
}

TEST(MWUserProcessSharedCacheTest, MeasuresWhatCanBeWritten) {
    World world({{.size = 0x10000, .pages = {kDirty, kDirty, kSwapped, kDirty}}},
                {{"__TEXT", 0, 0x5000}, {"__DATA", 0x6000, 0x3000}, {"__LINKEDIT", 0x9000, 0x5000}}, 16384);
    // The data has 0x2000 bytes of the page at 0x4000 and 0x1000 of the one at 0x8000. The gaps lie in pages
    // of text and linkedit.
    EXPECT_EQ(world.pieces(),
              (Lines{"0-5000 __TEXT|/lib/a 2 0+0", "5000-6000 " + kGap + " 2 0+0",
                     "6000-9000 __DATA|/lib/a 3 2000+1000", "9000-e000 __LINKEDIT|rtld shared cache 4 0+0",
                     "e000-10000 " + kGap + " 4 0+0"}));
    EXPECT_EQ(world.host.pageQueries, (Queries{{kCache + 0x4000, 2}}));
}

TEST(MWUserProcessSharedCacheTest, FailedMeasurementEndsGathering) {
    World world({{.size = 0x4000}, {.start = 0x4000, .size = 0x4000}}, {{"__DATA", 0x1000, 0x1000}});
    world.host.processes[7].pageQueryFailure = KERN_INVALID_ARGUMENT;
    const auto process = InspectedProcess::of(7);
    testing::internal::CaptureStderr();
    process->gatherData();
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "bailing out for process victim [7]; data may be incomplete!\n");
    EXPECT_EQ(process->memoryRegions()->size(), 2) << "the region below the cache, and the gap";
    EXPECT_EQ(process->errors(), Lines{"victim [7]: code 4"});
}

TEST(MWUserProcessSharedCacheTest, ListsImagesBySegment) {
    FakeHost host;
    host.sharedCache = true;
    const std::vector<FakeImage> images = {
        {"/lib/cached", kCache, {{"__DATA_CONST 1 of 2", 0x190000000, 0x10}, {"MACH_HEADER", kCache, 0x20}}},
        {"/bin/tool",
         0x1000,
         {{"", 0x3000, 0x30},
          {"__OBJC_RO", 0x1000, 0x40},
          {"__OBJC_RW", 0x4000, 0x10},
          {"__TEXT_EXEC", 0x5000, 0x10}}},
        {"/lib/cached", kCache + 0x100000000, {{"__LINKEDIT", 0x2000, 0x50}}},  // just behind the cache
    };
    host.processes[7] = {.comm = "victim", .images = images};
    host.processes[8] = {.comm = "other", .images = images};
    const MWImageList listed = InspectedProcess::of(7)->listImages();
    Lines lines;
    for (const MWImage& image : listed) {
        lines.push_back(fmt::format("{:x}+{:x} {} {} {}", image.start(), image.size(), *image.name(),
                                    image.segment(), *image.ownerPath()));
    }
    EXPECT_EQ(lines, (Lines{"1000+40 __OBJC_RO 2 /bin/tool", "2000+50 __LINKEDIT 4 /lib/cached",
                            "3000+30 unknown 0 /bin/tool", "4000+10 __OBJC_RW 3 /bin/tool",
                            "5000+10 __TEXT_EXEC 2 /bin/tool", "180000000+20 __TEXT 2 /lib/cached",
                            "190000000+10 __DATA_CONST 3 /lib/cached"}));

    const MWImageList other = InspectedProcess::of(8)->listImages();
    EXPECT_EQ(other[5].ownerPath().get(), listed[6].ownerPath().get()) << "one text for all processes";
    EXPECT_EQ(other[6].name().get(), listed[6].name().get());
}

}  // namespace
