#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "platform/linux/BackedVma.h"

/// Whether there can be pages that only smaps tells from others: those given up with MADV_FREE, those merged
/// with equal ones, and the dirty ones of a file. Many machines and most files have none, which can be seen
/// without asking each process; of files by root alone. Safe for use from several threads.
class UncountedPages {
public:
    /// `proc` is a descriptor of /proc; `mergedPages` the path where the kernel says how many pages it has
    /// merged.
    explicit UncountedPages(int proc, std::string mergedPages = "/sys/kernel/mm/ksm/pages_shared")
        : _proc(proc), _mergedPages(std::move(mergedPages)) {}

    /// Forgets what was found: files become dirty.
    void begin();
    /// Whether the pages of any process's anonymous memory can be of several kinds: somebody has lazily freed
    /// memory since the system was started, or pages are merged.
    bool canBeInAnonymousMemory();
    /// Whether anything at all is in swap: of shmem it cannot be told by the page tables.
    bool isSwapInUse();
    /// Whether no page of the mapped file is dirty. Opens the file, once for a measurement, and only where it
    /// lies on a disk of this machine: a look at one on a dead server could take for ever.
    bool isCleanFile(int memoryDirectory, const procfs::Vma& vma);

private:
    struct System {
        bool kindsOfAnonymousMemory;
        bool swapInUse;
        std::set<uint64_t> disks;  ///< major << 32 | minor
    };
    const System& _lookedAt();

    int _proc;
    std::string _mergedPages;
    std::mutex _mutex;  ///< guards what follows
    std::optional<System> _system;
    std::map<std::pair<uint64_t, uint64_t>, bool> _isClean;  ///< by device and inode
};
