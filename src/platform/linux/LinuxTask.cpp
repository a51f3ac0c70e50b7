#include "platform/linux/LinuxTask.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <string>
#include <utility>

#include "platform/linux/SmapsParser.h"

namespace {

std::optional<procfs::ProcStat> readStat(int directory) {
    std::string text;
    return procfs::readFile(directory, "stat", text) ? procfs::parseStat(text) : std::nullopt;
}

procfs::Descriptor openDirectory(int parent, const std::string& path) {
    return procfs::open(parent, path.c_str(), O_PATH | O_DIRECTORY);
}

// A thread of the process that has not ended; none when there is none left.
procfs::Descriptor openLiveThread(int processDirectory) {
    procfs::Descriptor list = procfs::open(processDirectory, "task", O_DIRECTORY);
    DIR* threads = list ? fdopendir(list.get()) : nullptr;
    if (threads == nullptr) {
        return {};
    }
    list.release();  // closed with the stream
    procfs::Descriptor found;
    while (const dirent* entry = readdir(threads)) {
        procfs::Descriptor thread = openDirectory(dirfd(threads), entry->d_name);
        const auto stat = entry->d_name[0] == '.' || !thread ? std::nullopt : readStat(thread.get());
        if (stat && !stat->firstThreadEnded()) {
            found = std::move(thread);
            break;
        }
    }
    closedir(threads);
    return found;
}

// Whether the kernel lets the caller look at the memory. Of a process that has ended there is none to look
// at, which is no refusal.
bool mayLook(int memoryDirectory) {
    return static_cast<bool>(procfs::open(memoryDirectory, "maps")) || errno == ESRCH;
}

// The link reads "ipc:[NUMBER]".
uint64_t ipcNamespace(int processDirectory) {
    std::string target;
    uint64_t number = 0;
    if (procfs::readLink(processDirectory, "ns/ipc", target)) {
        std::string_view text = target;
        procfs::takePrefix(text, "ipc:[");
        procfs::takeNumber(text, number);
    }
    return number;
}

}  // namespace

std::unique_ptr<LinuxTask> LinuxTask::open(int procDirectory, int32_t pid) {
    std::unique_ptr<LinuxTask> task(new LinuxTask);
    task->_pid = pid;
    task->_directory = openDirectory(procDirectory, std::to_string(pid));
    const auto stat = task->_directory ? task->_readStat() : std::nullopt;
    if (!stat) {
        return nullptr;
    }
    task->_startTime = stat->startTime;
    if (stat->firstThreadEnded() && !stat->isZombie()) {
        task->_thread = openLiveThread(task->directory());
    }
    return mayLook(task->_memoryDirectory()) ? std::move(task) : nullptr;
}

std::optional<procfs::ProcStat> LinuxTask::_readStat() const {
    return readStat(directory());
}

// The text of a large process is tens of megabytes, so it is parsed as it comes. The kernel hands out a page
// of text at a time and lets go of the process's memory map in between.
bool LinuxTask::_parseSmaps(std::vector<procfs::Vma>& vmas) const {
    constexpr size_t kBufferSize = 64U << 10U;
    thread_local std::array<char, kBufferSize> buffer;
    const procfs::Descriptor file = procfs::open(_memoryDirectory(), "smaps");
    if (!file) {
        return false;
    }
    procfs::SmapsParser parser;
    ptrdiff_t count = 0;
    while ((count = procfs::readSome(file.get(), buffer)) > 0) {
        parser.feed({buffer.data(), static_cast<size_t>(count)});
    }
    const int error = errno;
    vmas = parser.finish();
    errno = error;
    return count == 0;
}

// A text that the process's end or its exec cuts short ends like any other, so the process is looked at
// before and after: one that executes another program meanwhile is read again.
kern_return_t LinuxTask::takeSnapshot(const AddressSpaceContext& context) {
    if (_space) {
        return KERN_SUCCESS;
    }
    constexpr int kAttempts = 3;
    std::vector<procfs::Vma> vmas;
    auto before = _readStat();
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        const bool read = _parseSmaps(vmas);
        if (!read && errno != ESRCH) {
            return KERN_FAILURE;
        }
        const auto after = _readStat();
        if (!before || !after || after->isZombie()) {
            return MACH_SEND_INVALID_DEST;
        }
        if (std::exchange(before, after)->startStack == after->startStack) {
            break;
        }
    }
    if (vmas.empty()) {
        return KERN_INVALID_ADDRESS;
    }
    _space.emplace(std::move(vmas),
                   AddressSpaceOwner{_pid, _startTime, ipcNamespace(directory()), directory()}, context);
    return KERN_SUCCESS;
}

void LinuxTask::dropSnapshot() {
    _space.reset();
    _pagemap.reset();
    _entries = {};
}

bool LinuxTask::_readPagemap(uint64_t firstPage, std::span<PagemapEntry> entries) {
    if (!_pagemap) {
        _pagemap = procfs::open(_memoryDirectory(), "pagemap");
    }
    const auto bytes = std::as_writable_bytes(entries);
    const auto offset = static_cast<off_t>(firstPage * sizeof(PagemapEntry));
    return ::pread(_pagemap.get(), bytes.data(), bytes.size(), offset) ==
           static_cast<ptrdiff_t>(bytes.size());
}

kern_return_t LinuxTask::fillDispositions(uint64_t start, std::span<int32_t> words,
                                          const PageFrameFlags& frames, uint64_t pageSize) {
    std::fill(words.begin(), words.end(), 0);
    const uint64_t end = start + words.size() * pageSize;
    const AddressSpaceRegion* region = _space->regionAtOrAbove(start);
    const AddressSpaceRegion* const last = _space->regions().data() + _space->regions().size();
    for (; region != nullptr && region != last && region->start < end; ++region) {
        const uint64_t from = std::max(start, region->start);
        const uint64_t pages = (std::min(end, region->end()) - from) / pageSize;
        _entries.resize(pages);
        if (!_readPagemap(from / pageSize, _entries)) {
            return KERN_INVALID_ARGUMENT;
        }
        _dispositions.fill(*region, from, _entries, frames, pageSize,
                           words.subspan((from - start) / pageSize));
    }
    return KERN_SUCCESS;
}
