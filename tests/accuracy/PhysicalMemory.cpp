#include "accuracy/PhysicalMemory.h"

#include <fcntl.h>
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

/// Words of one of the kernel's page tables in files: 8 bytes for each page or frame.
class WordFile {
public:
    explicit WordFile(const std::string& path) : _file(open(path.c_str(), O_RDONLY | O_CLOEXEC)) {
        if (_file < 0) {
            throw std::runtime_error("cannot open " + path);
        }
    }
    ~WordFile() { close(_file); }
    WordFile(const WordFile&) = delete;
    WordFile& operator=(const WordFile&) = delete;

    /// As many of `count` words from `index` on as there are.
    std::vector<uint64_t> read(uint64_t index, uint64_t count) const {
        std::vector<uint64_t> words(count);
        const ssize_t size = pread(_file, words.data(), count * sizeof(uint64_t),
                                   static_cast<off_t>(index * sizeof(uint64_t)));
        words.resize(size > 0 ? static_cast<size_t>(size) / sizeof(uint64_t) : 0);
        return words;
    }

private:
    int _file;
};

struct Pages {
    std::vector<uint64_t> frames;
    std::vector<uint64_t> swapEntries;
};

void addPages(pid_t pid, Pages& pages) {
    constexpr uint64_t kAtOnce = 1U << 16U;
    const uint64_t number = bit(55) - 1;
    const WordFile pagemap(directoryOf(pid) + "pagemap");
    for (const AddressRange& range : mappingsOf(pid)) {
        for (uint64_t page = range.start / kPage; page < range.end / kPage; page += kAtOnce) {
            for (const uint64_t word : pagemap.read(page, std::min(kAtOnce, range.end / kPage - page))) {
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

// Bits as in the kernel's documentation of kpageflags.
bool isCharged(uint64_t flags) {
    const bool dirty = (flags & bit(4)) != 0;
    const bool anonymous = (flags & bit(12)) != 0;
    const bool swapBacked = (flags & bit(14)) != 0;
    const bool huge = (flags & bit(17)) != 0;
    const bool zeroPage = (flags & bit(24)) != 0;
    if (zeroPage) {
        return false;
    }
    // Anonymous memory that swap does not back was lazily freed.
    return huge || swapBacked || (dirty && !anonymous);
}

/// The kilobytes of all lines "KEY:  N kB" with one of the keys, in bytes.
uint64_t sumOfLines(const std::string& path, std::initializer_list<std::string_view> keys) {
    std::ifstream file(path);
    uint64_t sum = 0;
    for (std::string line; getline(file, line);) {
        const size_t colon = line.find(':');
        if (std::find(keys.begin(), keys.end(), std::string_view(line).substr(0, colon)) != keys.end()) {
            sum += std::stoull(line.substr(colon + 1)) * 1024;
        }
    }
    return sum;
}

/// Calls `block` with the flags of each frame.
template <class Block>
void forEachFlags(std::vector<uint64_t> frames, Block block) {
    constexpr uint64_t kAtOnce = 1024;
    const WordFile file("/proc/kpageflags");
    std::sort(frames.begin(), frames.end());
    uint64_t first = 0;
    std::vector<uint64_t> words;
    for (const uint64_t frame : frames) {
        if (frame < first || frame - first >= words.size()) {
            first = frame;
            words = file.read(first, kAtOnce);
        }
        block(words.empty() ? 0 : words[frame - first]);
    }
}

uint64_t dirtyFileBytes(pid_t pid) {
    Pages pages;
    addPages(pid, pages);
    uint64_t dirty = 0;
    forEachFlags(std::move(pages.frames), [&](uint64_t flags) {
        const uint64_t otherKinds = bit(12) | bit(14) | bit(17);
        dirty += (flags & otherKinds) == 0 && (flags & bit(4)) != 0 ? 1 : 0;
    });
    return dirty * kPage;
}

uint64_t hugePagesInUse() {
    std::ifstream file("/proc/meminfo");
    uint64_t total = 0;
    uint64_t free = 0;
    for (std::string key; file >> key;) {
        if (key == "HugePages_Total:") {
            file >> total;
        } else if (key == "HugePages_Free:") {
            file >> free;
        }
    }
    return total - free;
}

// What the processes map of shmem, each page once: meminfo knows only all shmem, mapped or not.
uint64_t mappedShmem() {
    uint64_t sum = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
        sum += sumOfLines(entry.path() / "smaps_rollup", {"Pss_Shmem"});
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
    uint64_t charged = 0;
    forEachFlags(std::move(pages.frames), [&](uint64_t flags) { charged += isCharged(flags) ? 1 : 0; });
    return (charged + pages.swapEntries.size()) * kPage;
}

uint64_t chargeOf(pid_t pid) {
    const std::string directory = directoryOf(pid);
    return sumOfLines(directory + "status", {"RssAnon", "RssShmem", "VmSwap", "HugetlbPages"}) +
           dirtyFileBytes(pid) - sumOfLines(directory + "smaps_rollup", {"LazyFree"});
}

uint64_t memoryInUse() {
    const auto meminfo = [](std::string_view key) { return sumOfLines("/proc/meminfo", {key}); };
    return meminfo("AnonPages") + mappedShmem() + meminfo("SwapTotal") - meminfo("SwapFree") +
           hugePagesInUse() * meminfo("Hugepagesize");
}

AddressRange largestMapping(pid_t pid) {
    const auto mappings = mappingsOf(pid);
    return *std::max_element(
        mappings.begin(), mappings.end(),
        [](const AddressRange& a, const AddressRange& b) { return a.end - a.start < b.end - b.start; });
}
