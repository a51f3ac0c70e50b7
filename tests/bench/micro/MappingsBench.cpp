#include <benchmark/benchmark.h>
#include <fmt/format.h>

#include <string>
#include <vector>

#include "platform/linux/SmapsParser.h"

namespace {

constexpr int64_t kOfAProcess = 60;
constexpr int64_t kOfALargeProcess = 60000;

// As Linux 6.18 writes it.
constexpr const char* kCounts =
    "Size:                 64 kB\nKernelPageSize:        4 kB\nMMUPageSize:           4 kB\n"
    "Rss:                  64 kB\nPss:                  64 kB\nPss_Dirty:            64 kB\n"
    "Shared_Clean:          0 kB\nShared_Dirty:          0 kB\nPrivate_Clean:         0 kB\n"
    "Private_Dirty:        64 kB\nReferenced:           64 kB\nAnonymous:            60 kB\n"
    "KSM:                   0 kB\nLazyFree:              4 kB\nAnonHugePages:         0 kB\n"
    "ShmemPmdMapped:        0 kB\nFilePmdMapped:         0 kB\nShared_Hugetlb:        0 kB\n"
    "Private_Hugetlb:       0 kB\nSwap:                  0 kB\nSwapPss:               0 kB\n"
    "Locked:                0 kB\nTHPeligible:           0\nVmFlags: rd wr mr mw me ac \n";

std::string textOf(int64_t mappings, const char* counts) {
    std::string text;
    for (int64_t index = 0; index < mappings; ++index) {
        const int64_t start = 0x7f0000000000 + index * 0x11000;
        const bool isFile = index % 3 == 0;
        text += fmt::format("{:x}-{:x} {} {:08x} {} {:<26}{}\n{}", start, start + 0x10000,
                            isFile ? "r-xp" : "rw-p", isFile ? 0x2000 : 0, isFile ? "fe:00" : "00:00",
                            isFile ? 247134 + index : 0,
                            isFile ? "/usr/lib/x86_64-linux-gnu/liblibrary.so.6" : "", counts);
    }
    return text;
}

// In the pieces in which the kernel hands it out.
void parseMappings(benchmark::State& state, const char* counts) {
    constexpr size_t kPiece = 4096;
    const std::string text = textOf(state.range(0), counts);
    std::vector<procfs::Vma> vmas;
    for (auto iteration : state) {
        procfs::SmapsParser parser(std::move(vmas));
        for (std::string_view left = text; !left.empty(); left.remove_prefix(std::min(kPiece, left.size()))) {
            parser.feed(left.substr(0, kPiece));
        }
        vmas = parser.finish();
    }
    if (vmas.size() != static_cast<size_t>(state.range(0))) {
        state.SkipWithError("not all mappings were read");
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
    state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(text.size()));
}

BENCHMARK_CAPTURE(parseMappings, maps, "")->Arg(kOfAProcess)->Arg(kOfALargeProcess);
BENCHMARK_CAPTURE(parseMappings, smaps, kCounts)->Arg(kOfAProcess)->Arg(kOfALargeProcess);

}  // namespace
