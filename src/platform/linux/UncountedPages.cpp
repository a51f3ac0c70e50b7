#include "platform/linux/UncountedPages.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <sys/sysinfo.h>

#include <algorithm>
#include <array>

#include "platform/linux/Cachestat.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"
#include "platform/linux/ShmemDevices.h"

namespace {

// Their mappings show the device that the mount has, and their files have no server.
constexpr std::array<std::string_view, 7> kDiskFileSystems = {"ext2", "ext3",  "ext4",    "xfs",
                                                              "f2fs", "erofs", "squashfs"};

// The value of a line "NAME VALUE"; none when there is no such line.
std::optional<uint64_t> valueOf(std::string_view text, std::string_view name) {
    while (!text.empty()) {
        std::string_view line = procfs::takeLine(text);
        uint64_t value = 0;
        if (procfs::takeWord(line) == name && procfs::takePrefix(line, " ") &&
            procfs::takeNumber(line, value)) {
            return value;
        }
    }
    return std::nullopt;
}

bool wasEverLazilyFreed(int proc) {
    std::string text;
    procfs::readFile(proc, "vmstat", text);
    return valueOf(text, "pglazyfree").value_or(1) != 0;
}

bool hasMergedPages(const std::string& path) {
    std::string text;
    if (!procfs::readFile(AT_FDCWD, path.c_str(), text)) {
        return false;  // a kernel that merges none
    }
    std::string_view number = text;
    uint64_t pages = 0;
    return !procfs::takeNumber(number, pages) || pages != 0;
}

bool hasSwapInUse() {
    struct sysinfo system = {};
    return sysinfo(&system) != 0 || system.freeswap != system.totalswap;
}

std::set<uint64_t> devicesOfDisks(int proc) {
    constexpr size_t kLongestMountinfo = 64U << 20U;
    std::string text;
    procfs::readFile(proc, "self/mountinfo", text, kLongestMountinfo);
    std::set<uint64_t> devices;
    for (const procfs::Mount& mount : procfs::parseMountinfo(text)) {
        if (std::ranges::find(kDiskFileSystems, mount.fileSystem) != kDiskFileSystems.end()) {
            devices.insert(mount.device);
        }
    }
    return devices;
}

// The mapped file itself, whatever lies at its path by now. A device node is only looked at: to open it can
// have effects.
procfs::Descriptor openMappedFile(int memoryDirectory, const procfs::Vma& vma) {
    const std::string name = fmt::format("map_files/{:x}-{:x}", vma.start, vma.end);
    const procfs::Descriptor node = procfs::open(memoryDirectory, name.c_str(), O_PATH);
    struct statx status = {};
    constexpr int kOfDescriptor = AT_EMPTY_PATH | AT_STATX_DONT_SYNC;
    if (!node || statx(node.get(), "", kOfDescriptor, STATX_TYPE, &status) != 0 ||
        !S_ISREG(status.stx_mode)) {
        return {};
    }
    return procfs::open(memoryDirectory, name.c_str(), O_NONBLOCK | O_NOCTTY);
}

// A mapped page is in the page cache; where none is, the answer is about something else.
bool readIsClean(int memoryDirectory, const procfs::Vma& vma) {
    const procfs::Descriptor file = openMappedFile(memoryDirectory, vma);
    const std::optional<Cachestat> pages = file ? readCachestat(file.get()) : std::nullopt;
    return pages && pages->cached != 0 && pages->dirty == 0 && pages->writeback == 0;
}

}  // namespace

void UncountedPages::begin() {
    const std::lock_guard lock(_mutex);
    _system.reset();
    _isClean.clear();
}

const UncountedPages::System& UncountedPages::_lookedAt() {
    if (!_system) {
        _system = {.kindsOfAnonymousMemory = wasEverLazilyFreed(_proc) || hasMergedPages(_mergedPages),
                   .swapInUse = hasSwapInUse(),
                   .disks = devicesOfDisks(_proc)};
    }
    return *_system;
}

bool UncountedPages::canBeInAnonymousMemory() {
    const std::lock_guard lock(_mutex);
    return _lookedAt().kindsOfAnonymousMemory;
}

bool UncountedPages::isSwapInUse() {
    const std::lock_guard lock(_mutex);
    return _lookedAt().swapInUse;
}

bool UncountedPages::isCleanFile(int memoryDirectory, const procfs::Vma& vma) {
    const std::lock_guard lock(_mutex);
    if (!_lookedAt().disks.contains(vma.device())) {
        return false;
    }
    const auto [entry, isNew] = _isClean.try_emplace({vma.device(), vma.inode});
    if (isNew) {
        entry->second = readIsClean(memoryDirectory, vma);
    }
    return entry->second;
}
