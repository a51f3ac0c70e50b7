#include "fuzz/FuzzTargets.h"

#include <algorithm>
#include <cstdint>
#include <stdexcept>
#include <string>
#include <vector>

#include "platform/HeapsnapReader.h"
#include "platform/linux/Fdinfo.h"
#include "platform/linux/KernelTexts.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/SmapsParser.h"
#include "platform/linux/SysVSegments.h"

namespace {

using procfs::Vma;

void require(bool isKept, const char* promise) {
    if (!isKept) {
        throw std::logic_error(promise);
    }
}

bool isWord(std::string_view text) {
    return !text.empty() && text.find_first_of(" \t\n") == std::string_view::npos;
}

void readHeapsnap(std::string_view text) {
    const auto reader = HeapsnapReader::open(text);
    if (!reader) {
        const auto& description = reader.error().description;
        require(description && isWord(description->substr(0, 1)), "a refusal says why");
        require(description->find('\n') == std::string::npos, "a refusal is one line");
        return;
    }
    require((*reader)->process().pageSize != 0 && (*reader)->process().pid >= 0, "the process can be one");
    uint64_t end = 0;
    bool isFull = false;  // the last region ended with the address space
    (*reader)->enumerateRegions([&](const HeapsnapRegion& region) {
        require(region.start >= end && (!isFull || region.length == 0), "regions ascend without overlap");
        end = region.start + region.length;
        isFull = isFull || (end == 0 && region.length != 0);
        require(isFull || end >= region.start, "regions end within the address space");
        end = isFull ? region.start : end;
        require(region.type != nullptr && region.path != nullptr, "regions have texts");
        return false;
    });
}

// As reads deliver it that end anywhere.
std::vector<Vma> parseInPieces(std::string_view text) {
    const size_t step = text.empty() ? 1 : 1 + static_cast<unsigned char>(text.back());
    procfs::SmapsParser parser;
    for (; !text.empty(); text.remove_prefix(std::min(step, text.size()))) {
        parser.feed(text.substr(0, step));
    }
    return parser.finish();
}

void readSmaps(std::string_view text) {
    constexpr uint64_t Vma::*kCounts[] = {
        &Vma::rss,       &Vma::pss,    &Vma::sharedClean, &Vma::sharedDirty,   &Vma::privateDirty,
        &Vma::anonymous, &Vma::ksm,    &Vma::lazyFree,    &Vma::sharedHugetlb, &Vma::privateHugetlb,
        &Vma::swap,      &Vma::swapPss};
    const std::vector<Vma> vmas = procfs::parseSmaps(text);
    uint64_t lowest = 0;
    for (const Vma& vma : vmas) {
        require(vma.start >= lowest && vma.end > vma.start, "mappings ascend, without overlap and not empty");
        lowest = vma.end;
        for (const auto count : kCounts) {
            require(vma.*count <= vma.size(), "no count is larger than its mapping");
            require(vma.hasCounts || vma.*count == 0, "counts are said to be there");
        }
    }
    require(vmas == parseInPieces(text), "it does not matter where reads end");
}

// `stat`, `status` and the small files beside them.
void readStat(std::string_view text) {
    if (const auto stat = procfs::parseStat(text)) {
        require(stat->pid >= 0 && stat->ppid >= 0, "pids are not negative");
        require(isWord({&stat->state, 1}), "a state is a letter");
    }
    const procfs::ProcStatus status = procfs::parseStatus(text);
    for (const uint64_t bytes :
         {status.vmHwm, status.rssAnon, status.rssShmem, status.vmPte, status.vmSwap, status.hugetlbPages}) {
        require(bytes % 1024 == 0 && (status.hasMemory || bytes == 0), "sizes are of memory, in kB");
    }
    require(
        procfs::nameFromCommandLine(text).find_first_of(std::string_view(" :/\0", 4)) == std::string::npos,
        "a name is that of a file");
    require(procfs::auxvIs64bit(text).has_value() == (text.size() >= 8), "eight bytes tell the width");
    require(procfs::parseNamespace(text) == 0 || text.ends_with(']'), "a namespace is in brackets");
}

void readFdinfo(std::string_view text) {
    if (const auto client = procfs::parseDrmClient(text)) {
        require(!client->device.empty(), "a client is one of a device");
        require(client->purgeable <= client->resident && client->resident <= client->total,
                "purgeable bytes are resident, resident ones are there");
    }
    procfs::parseDmaBuffer(text);
    procfs::parseBpfMap(text);
}

void readKernelRows(std::string_view text) {
    for (const procfs::SlabCache& cache : procfs::parseSlabinfo(text)) {
        require(isWord(cache.name.substr(0, 1)) && !cache.name.ends_with(' '), "a cache has a name");
    }
    for (const procfs::LoadedModule& module : procfs::parseModules(text)) {
        require(isWord(module.name), "a module has a name");
    }
    for (const procfs::AllocationSite& site : procfs::parseAllocinfo(text)) {
        require(site.line >= 0 && (site.module.empty() || isWord(site.module)), "a site is a place");
    }
    for (const auto& [caller, pages] : procfs::parseVmallocinfo(text)) {
        const std::string function = caller.function();
        require(caller.name().starts_with(function) && caller.name().empty() == function.empty(),
                "a caller is named for its function");
        require(caller.address() == 0 || function.empty(), "an address has no name");
        require(caller.call.empty() || isWord(caller.call.substr(0, 1)), "a call is told first");
    }
}

// What tells of the kernel's own memory, and of segments that belong to nobody.
void readKernel(std::string_view text) {
    readKernelRows(text);
    const procfs::Figures meminfo = procfs::parseMeminfo(text);
    require(meminfo["Slab"] % 1024 == 0, "sizes are in kB");
    require(meminfo.sum({"Slab", "Active"}) >= std::max(meminfo["Slab"], meminfo["Active"]),
            "sums do not wrap");
    procfs::parseVmstat(text);
    procfs::pagesInPerCpuLists(text);
    for (const procfs::SysVSegment& segment : procfs::parseSysVSegments(text)) {
        require(segment.creator >= 0, "pids are not negative");
    }
}

constexpr FuzzTarget kTargets[] = {{"fdinfo", readFdinfo},
                                   {"heapsnap", readHeapsnap},
                                   {"kernel", readKernel},
                                   {"smaps", readSmaps},
                                   {"stat", readStat}};

}  // namespace

std::span<const FuzzTarget> fuzzTargets() {
    return kTargets;
}
