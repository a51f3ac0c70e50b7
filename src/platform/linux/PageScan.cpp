#include "platform/linux/PageScan.h"

#include <sys/ioctl.h>

#include "platform/MWProgress.h"

namespace {

// The headers of older systems do not have it.
struct ScanArguments {
    uint64_t size;
    uint64_t flags;
    uint64_t start;
    uint64_t end;
    uint64_t walkEnd;
    uint64_t regions;
    uint64_t regionCount;
    uint64_t maxPages;
    uint64_t categoryInverted;
    uint64_t categoryMask;
    uint64_t categoryAnyOfMask;
    uint64_t returnMask;
};

constexpr unsigned long kPagemapScan = _IOWR('f', 16, ScanArguments);

}  // namespace

int scanPages(int pagemap, const PageScan& scan, std::span<ScannedRange> ranges, uint64_t& walkEnd) {
    ScanArguments arguments = {};
    arguments.size = sizeof(arguments);
    arguments.start = scan.start;
    arguments.end = scan.end;
    arguments.regions = reinterpret_cast<uint64_t>(ranges.data());
    arguments.regionCount = ranges.size();
    arguments.maxPages = scan.mostPages;
    arguments.categoryAnyOfMask = scan.anyOf;
    arguments.returnMask = scan.told;
    const int count = ioctl(pagemap, kPagemapScan, &arguments);
    MWProgress::mark();
    walkEnd = arguments.walkEnd;
    return count;
}
