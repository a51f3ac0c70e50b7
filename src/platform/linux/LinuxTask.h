#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <vector>

#include "platform/MWHostRecords.h"
#include "platform/linux/AddressSpace.h"
#include "platform/linux/PageDispositions.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

/// What a task handle stands for: one process, held by its open directory, and during a walk the snapshot of
/// its address space. Used by one thread at a time.
class LinuxTask {
public:
    /// None when there is no such process or the caller may not look at its memory. A process that has ended
    /// but is still there can be opened: its address space is then gone.
    static std::unique_ptr<LinuxTask> open(int procDirectory, int32_t pid);

    int32_t pid() const { return _pid; }
    /// /proc/PID, opened with O_PATH.
    int directory() const { return _directory.get(); }

    /// Takes a snapshot unless there is one. MACH_SEND_INVALID_DEST when the process has ended,
    /// KERN_INVALID_ADDRESS when it lives and has no memory of its own, KERN_FAILURE when the kernel refuses.
    kern_return_t takeSnapshot(const AddressSpaceContext& context);
    bool hasSnapshot() const { return _space.has_value(); }
    /// There must be a snapshot.
    const AddressSpace& addressSpace() const { return *_space; }
    void dropSnapshot();

    /// One word for each page from `start` on; pages outside of every region read as absent. There must be a
    /// snapshot. KERN_INVALID_ARGUMENT when the process has ended.
    kern_return_t fillDispositions(uint64_t start, std::span<int32_t> words, const PageFrameFlags& frames,
                                   uint64_t pageSize);

private:
    LinuxTask() = default;

    std::optional<procfs::ProcStat> _readStat() const;
    /// The directory to read memory through: a process whose first thread has ended shows nothing there.
    int _memoryDirectory() const { return _thread ? _thread.get() : _directory.get(); }
    bool _parseSmaps(std::vector<procfs::Vma>& vmas) const;
    bool _readPagemap(uint64_t firstPage, std::span<PagemapEntry> entries);

    int32_t _pid = 0;
    uint64_t _startTime = 0;
    procfs::Descriptor _directory;
    procfs::Descriptor _thread;  ///< task/TID of a thread that lives, when the first one does not
    procfs::Descriptor _pagemap;
    std::optional<AddressSpace> _space;
    PageDispositions _dispositions;
    std::vector<PagemapEntry> _entries;
};
