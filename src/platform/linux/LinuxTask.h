#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

#include "platform/MWHostRecords.h"
#include "platform/linux/AddressSpace.h"
#include "platform/linux/ForkCensus.h"
#include "platform/linux/LivePages.h"
#include "platform/linux/MappingCounts.h"
#include "platform/linux/OwnedObjectSurvey.h"
#include "platform/linux/PageDispositions.h"
#include "platform/linux/PageTables.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"
#include "platform/linux/SharedAddressSpaces.h"
#include "platform/linux/UncountedPages.h"

/// Where the counts of a mapping come from.
enum class MappingSource : uint8_t {
    smaps,     ///< with everything that it tells
    cheapest,  ///< the same figures; the protections that a mapping may have are not known
};

/// What all the tasks of a run share.
struct LinuxRun {
    LinuxRun(const std::string& procDirectory, MappingSource mappingSource);

    procfs::Descriptor proc;
    uint64_t pageSize;
    ObjectIdentity identity;
    ShmemDevices shmemDevices;
    RegionNames names;
    ForkFamilies families;
    SharedAddressSpaces sharedSpaces;
    OwnedObjectSurvey ownedObjects;
    UncountedPages uncountedPages;
    ForkCensus forkCensus;
    PageTables pageTables;
    PageFrameFlags frames;
    PagemapEntry untouchedPage;  ///< of this process, to know the zero page by
    MappingSource mappingSource;

    /// A new measurement begins: what was found out about processes for the last one is forgotten.
    void begin();
    bool seesFrames() const { return untouchedPage.frame() != 0; }
};

/// A process as the list of processes has shown it, for the task that is made of it next.
struct ListedProcess {
    procfs::Descriptor directory;
    procfs::ProcStat stat;
    std::string auxv;
    std::string executable;  ///< its path; empty where that is hidden
};

struct LiveThread {
    int32_t identifier = 0;
    procfs::Descriptor directory;
    procfs::ProcStat stat;
};
/// A thread of the process that has not ended; without a directory when there is none left.
LiveThread openLiveThread(int processDirectory);
/// Whether a thread of the process lives, be it the first one or another.
bool hasLiveThread(int processDirectory);

/// What a task handle stands for: one process, held by its open directory, and during a walk the snapshot of
/// its address space. Used by one thread at a time.
class LinuxTask {
public:
    /// None when there is no such process or the caller may not look at its memory. A process that has ended
    /// but is still there can be opened: its address space is then gone. `run` outlives the task.
    static std::unique_ptr<LinuxTask> open(LinuxRun& run, int32_t pid);
    /// The same of a process that has been looked at a moment ago.
    static std::unique_ptr<LinuxTask> open(LinuxRun& run, int32_t pid, ListedProcess listed);
    ~LinuxTask();
    LinuxTask(const LinuxTask&) = delete;
    LinuxTask& operator=(const LinuxTask&) = delete;

    int32_t pid() const { return _pid; }
    /// /proc/PID, opened with O_PATH.
    int directory() const { return _directory.get(); }
    /// As the list of processes showed it; empty when the process was not listed.
    const std::string& executable() const { return _executable; }
    /// The same, or /proc/PID/task/TID of a thread that lives where the first one has ended.
    int memoryDirectory() const { return _thread ? _thread.get() : _directory.get(); }

    /// Takes a snapshot unless there is one. MACH_SEND_INVALID_DEST when the process has ended,
    /// KERN_INVALID_ADDRESS when it lives and has no memory of its own, KERN_FAILURE when the kernel refuses.
    kern_return_t takeSnapshot();
    /// What is doubtful about the snapshots taken since the last call, a sentence each.
    std::vector<std::string> takeWarnings() { return std::exchange(_warnings, {}); }
    bool hasSnapshot() const { return _space.has_value(); }
    /// There must be a snapshot.
    const AddressSpace& addressSpace() const { return *_space; }
    void dropSnapshot();

    /// One word for each page from `start` on; pages outside of every region read as absent. There must be a
    /// snapshot. KERN_INVALID_ARGUMENT when the process has ended.
    kern_return_t fillDispositions(uint64_t start, std::span<int32_t> words);

    /// `status`, at most 50 ms old: several questions about one process come together. None when the process
    /// is gone.
    std::optional<procfs::ProcStatus> status();

    /// Whether its memory goes under another process's name, with which it shares one address space.
    bool sharesAnothersSpace();
    /// Counts the process among those of the measurement, and looks at what it holds through descriptors if
    /// so wanted, before any process is measured.
    void survey(bool withOwnedObjects);
    /// What the process is charged for beside its regions. May take a snapshot.
    std::vector<OwnedObjectRecord> ownedObjects();

private:
    LinuxTask(LinuxRun& run, int32_t pid, ListedProcess listed);

    /// False when no thread of the process lives.
    bool _chooseThread();
    void _surveyOwnedObjects();

    struct Mappings {
        std::vector<procfs::Vma> texts;
        std::vector<BackedVma> vmas;  ///< of `texts`
        bool isAlone = false;         ///< see ForkCensus
        /// Where smaps was not read: see countWithoutSmaps.
        std::optional<std::vector<ScannedRange>> filePages;

        /// Gives the room of very many mappings back, which few processes need.
        void forgetMany();
    };
    kern_return_t _takeSnapshotOnce();
    kern_return_t _readMappings(Mappings& mappings);
    bool _readMappingsOnce(Mappings& mappings);
    bool _countsPayOff(const procfs::ProcStatus& status) const;
    bool _runsTheSame();
    std::unordered_set<uint64_t> _shownObjects();
    bool _isHole(const AddressSpaceRegion& region, uint64_t start, uint64_t end);
    bool _readEntries(const AddressSpaceRegion& region, uint64_t address);
    SharedAddressSpaces::Candidate _candidate() const {
        return {{_pid, _startTime}, _threadId, _stat.startStack};
    }
    ForkFamily& _family();
    void _checkFamilyMemory();

    LinuxRun& _run;
    int32_t _pid;
    uint64_t _startTime = 0;
    procfs::Descriptor _directory;
    int32_t _threadId;           ///< a thread that lives
    procfs::Descriptor _thread;  ///< its task/TID, when it is not the first one
    procfs::ProcStat _stat;      ///< of that thread, as last seen
    std::string _executable;
    uint64_t _program = 0;  ///< stands for its auxv, which each exec makes anew; 0 for none
    uint64_t _exec = 0;     ///< see ForkCensus
    std::optional<procfs::ProcStatus> _status;
    uint64_t _statusTime = 0;                 ///< nanoseconds of CLOCK_MONOTONIC
    std::shared_ptr<ForkFamily> _forkFamily;  ///< held, so that its frames stay known while its members live
    std::vector<std::string> _warnings;
    std::optional<LivePages> _pages;
    std::optional<AddressSpace> _space;
    PageDispositions _dispositions;
    std::vector<PagemapEntry> _entries;
    uint64_t _holeStart = 0;  ///< pages that are known to be absent
    uint64_t _holeEnd = 0;
};
