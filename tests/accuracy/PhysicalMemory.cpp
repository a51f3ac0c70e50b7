#include "accuracy/PhysicalMemory.h"

#include <fcntl.h>
#include <linux/kcmp.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <string_view>
#include <utility>

namespace {

constexpr uint64_t kPage = 4096;

constexpr uint64_t bit(unsigned number) {
    return uint64_t{1} << number;
}

std::string directoryOf(pid_t pid) {
    return "/proc/" + std::to_string(pid) + "/";
}

std::vector<AddressRange> mappingsOf(pid_t pid) {
    std::ifstream maps(directoryOf(pid) + "maps");
    std::vector<AddressRange> ranges;
    char dash = 0;
    std::string rest;
    for (AddressRange range; maps >> std::hex >> range.start >> dash >> range.end && getline(maps, rest);) {
        ranges.push_back(range);
    }
    return ranges;
}

/// Words of one of the kernel's page tables in files, 8 bytes for each page or frame: as many of `count` from
/// `index` on as there are.
std::vector<uint64_t> readWords(const std::string& path, uint64_t index, uint64_t count) {
    const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (file < 0) {
        throw std::runtime_error("cannot open " + path);
    }
    std::vector<uint64_t> words(count);
    const ssize_t size =
        pread(file, words.data(), count * sizeof(uint64_t), static_cast<off_t>(index * sizeof(uint64_t)));
    close(file);
    words.resize(size > 0 ? static_cast<size_t>(size) / sizeof(uint64_t) : 0);
    return words;
}

/// Page frames and swap entries.
struct Pages {
    std::vector<uint64_t> frames;
    std::vector<uint64_t> swapEntries;
};

void addPages(pid_t pid, Pages& pages) {
    constexpr uint64_t kAtOnce = 1U << 16U;
    const uint64_t number = bit(55) - 1;
    const std::string pagemap = directoryOf(pid) + "pagemap";
    for (const AddressRange& range : mappingsOf(pid)) {
        for (uint64_t page = range.start / kPage; page < range.end / kPage; page += kAtOnce) {
            for (const uint64_t word :
                 readWords(pagemap, page, std::min(kAtOnce, range.end / kPage - page))) {
                if ((word & bit(63)) != 0) {
                    pages.frames.push_back(word & number);
                } else if ((word & bit(62)) != 0) {
                    pages.swapEntries.push_back(word & number);
                }
            }
        }
    }
}

void makeDistinct(std::vector<uint64_t>& numbers) {
    std::sort(numbers.begin(), numbers.end());
    numbers.erase(std::unique(numbers.begin(), numbers.end()), numbers.end());
}

// What a frame holds, with bits as in the kernel's documentation of kpageflags.
bool isDirtyFile(uint64_t flags) {
    return (flags & bit(4)) != 0 && (flags & (bit(12) | bit(14) | bit(17) | bit(24))) == 0;
}

// Huge, or backed by swap: anonymous memory that swap does not back was lazily freed. Not the zero page.
bool isCharged(uint64_t flags) {
    return ((flags & (bit(14) | bit(17))) != 0 && (flags & bit(24)) == 0) || isDirtyFile(flags);
}

/// The bytes of the frames of this kind.
uint64_t bytesOf(std::vector<uint64_t> frames, bool (*isKind)(uint64_t flags)) {
    constexpr uint64_t kAtOnce = 1024;
    std::sort(frames.begin(), frames.end());
    uint64_t first = 0;
    uint64_t count = 0;
    std::vector<uint64_t> words;
    for (const uint64_t frame : frames) {
        if (frame < first || frame - first >= words.size()) {
            first = frame;
            words = readWords("/proc/kpageflags", first, kAtOnce);
        }
        count += !words.empty() && isKind(words[frame - first]) ? 1 : 0;
    }
    return count * kPage;
}

/// The sum of all lines "KEY:  N" with one of the keys.
uint64_t sumOfLines(const std::string& path, std::initializer_list<std::string_view> keys) {
    std::ifstream file(path);
    uint64_t sum = 0;
    for (std::string line; getline(file, line);) {
        const size_t colon = line.find(':');
        if (std::find(keys.begin(), keys.end(), std::string_view(line).substr(0, colon)) != keys.end()) {
            sum += std::stoull(line.substr(colon + 1));
        }
    }
    return sum;
}

uint64_t bytesOfLines(const std::string& path, std::initializer_list<std::string_view> keys) {
    return sumOfLines(path, keys) * 1024;
}

// What the processes map of shmem, each page once: meminfo knows only all shmem, mapped or not.
uint64_t mappedShmem() {
    uint64_t sum = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
        sum += bytesOfLines(entry.path() / "smaps_rollup", {"Pss_Shmem"});
    }
    return sum;
}

bool shareOneAddressSpace(pid_t one, pid_t other) {
    return syscall(SYS_kcmp, one, other, KCMP_VM, 0, 0) == 0;
}

uint64_t pageTablesOf(const std::vector<pid_t>& pids) {
    uint64_t sum = 0;
    for (auto pid = pids.begin(); pid != pids.end(); ++pid) {
        const bool isCounted = std::any_of(
            pids.begin(), pid, [=](pid_t earlier) { return shareOneAddressSpace(earlier, *pid); });
        sum += isCounted ? 0 : bytesOfLines(directoryOf(*pid) + "status", {"VmPTE"});
    }
    return sum;
}

}  // namespace

uint64_t physicalMemoryOf(const std::vector<pid_t>& pids) {
    Pages pages;
    for (const pid_t pid : pids) {
        addPages(pid, pages);
    }
    makeDistinct(pages.frames);
    makeDistinct(pages.swapEntries);
    return bytesOf(std::move(pages.frames), isCharged) + pages.swapEntries.size() * kPage +
           pageTablesOf(pids);
}

uint64_t chargeOf(pid_t pid) {
    const std::string directory = directoryOf(pid);
    Pages pages;
    addPages(pid, pages);
    return bytesOfLines(directory + "status", {"RssAnon", "RssShmem", "VmSwap", "HugetlbPages", "VmPTE"}) +
           bytesOf(std::move(pages.frames), isDirtyFile) -
           bytesOfLines(directory + "smaps_rollup", {"LazyFree"});
}

uint64_t memoryInUse() {
    const std::string meminfo = "/proc/meminfo";
    const uint64_t hugePages =
        sumOfLines(meminfo, {"HugePages_Total"}) - sumOfLines(meminfo, {"HugePages_Free"});
    return bytesOfLines(meminfo, {"AnonPages", "SwapTotal", "PageTables"}) -
           bytesOfLines(meminfo, {"SwapFree"}) + mappedShmem() +
           hugePages * bytesOfLines(meminfo, {"Hugepagesize"});
}

AddressRange largestMapping(pid_t pid) {
    const auto mappings = mappingsOf(pid);
    return *std::max_element(
        mappings.begin(), mappings.end(),
        [](const AddressRange& a, const AddressRange& b) { return a.end - a.start < b.end - b.start; });
}
