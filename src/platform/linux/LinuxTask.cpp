#include "platform/linux/LinuxTask.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <functional>
#include <string>
#include <unordered_set>
#include <utility>

#include "platform/MWHeap.h"
#include "platform/linux/SmapsParser.h"

namespace {

std::optional<procfs::ProcStat> readStat(int directory) {
    std::string text;
    return procfs::readRecord(directory, "stat", text) ? procfs::parseStat(text) : std::nullopt;
}

procfs::Descriptor openDirectory(int parent, const std::string& path) {
    return procfs::open(parent, path.c_str(), O_PATH | O_DIRECTORY);
}

procfs::ProcStat endedThread() {
    procfs::ProcStat stat;
    stat.state = 'X';
    return stat;
}

std::string bootId(int procDirectory) {
    std::string text;
    procfs::readFile(procDirectory, "sys/kernel/random/boot_id", text);
    return text;
}

uint64_t monotonicNanoseconds() {
    constexpr uint64_t kNanosecondsPerSecond = 1'000'000'000;
    timespec time = {};
    clock_gettime(CLOCK_MONOTONIC_COARSE, &time);
    return static_cast<uint64_t>(time.tv_sec) * kNanosecondsPerSecond + static_cast<uint64_t>(time.tv_nsec);
}

uint64_t programOf(int memoryDirectory, const ObjectIdentity& identity) {
    std::string auxv;
    return procfs::readRecord(memoryDirectory, "auxv", auxv) && !auxv.empty() ? identity.bytes(auxv) : 0;
}

bool hasSysVSegments(const std::vector<BackedVma>& vmas) {
    return std::ranges::any_of(vmas, [](const BackedVma& backed) { return isSysVSegment(backed.vma); });
}

// Whether the kernel lets the caller look at the memory. Of a process that has ended there is none to look
// at, which is no refusal.
bool mayLook(int memoryDirectory) {
    return static_cast<bool>(procfs::open(memoryDirectory, "maps")) || errno == ESRCH;
}

}  // namespace

LinuxRun::LinuxRun(const std::string& procDirectory, MappingSource source)
    : proc(procfs::open(AT_FDCWD, procDirectory.c_str(), O_DIRECTORY)),
      pageSize(static_cast<uint64_t>(sysconf(_SC_PAGESIZE))),
      identity(bootId(proc.get())),
      ownedObjects(
          {.proc = proc.get(), .pageSize = pageSize, .shmemDevices = shmemDevices, .identity = identity}),
      uncountedPages(proc.get()),
      frames(procfs::open(proc.get(), "kpageflags")),
      untouchedPage(lookAtUntouchedPage(proc.get(), pageSize)),
      mappingSource(source) {}

void LinuxRun::begin() {
    ownedObjects.begin();
    uncountedPages.begin();
    forkCensus.begin();
}

LinuxTask::LinuxTask(LinuxRun& run, int32_t pid, ListedProcess listed)
    : _run(run),
      _pid(pid),
      _startTime(listed.stat.startTime),
      _directory(std::move(listed.directory)),
      _threadId(pid),
      _stat(std::move(listed.stat)),
      _executable(std::move(listed.executable)) {}

LiveThread openLiveThread(int processDirectory) {
    LiveThread found;
    procfs::forEachEntry(processDirectory, "task", [&](int threads, const char* name) {
        procfs::Descriptor thread = openDirectory(threads, name);
        const auto stat = thread ? readStat(thread.get()) : std::nullopt;
        if (stat && !stat->threadEnded()) {
            found = {stat->pid, std::move(thread), *stat};
        }
        return !found.directory;
    });
    return found;
}

bool hasLiveThread(int processDirectory) {
    return static_cast<bool>(openLiveThread(processDirectory).directory);
}

std::unique_ptr<LinuxTask> LinuxTask::open(LinuxRun& run, int32_t pid) {
    ListedProcess listed;
    listed.directory = openDirectory(run.proc.get(), std::to_string(pid));
    const auto stat = listed.directory ? readStat(listed.directory.get()) : std::nullopt;
    if (!stat) {
        return nullptr;
    }
    listed.stat = *stat;
    procfs::readRecord(listed.directory.get(), "auxv", listed.auxv);
    return open(run, pid, std::move(listed));
}

std::unique_ptr<LinuxTask> LinuxTask::open(LinuxRun& run, int32_t pid, ListedProcess listed) {
    std::string auxv = std::move(listed.auxv);
    std::unique_ptr<LinuxTask> task(new LinuxTask(run, pid, std::move(listed)));
    if (task->_stat.threadEnded() && task->_chooseThread()) {
        procfs::readRecord(task->memoryDirectory(), "auxv", auxv);
    }
    // Whoever may read auxv may read maps.
    if (auxv.empty() && !mayLook(task->memoryDirectory())) {
        return nullptr;
    }
    task->_program = auxv.empty() ? 0 : run.identity.bytes(auxv);
    task->_exec = randomBytesAddress(auxv).value_or(0);
    return task;
}

LinuxTask::~LinuxTask() {
    _run.pageTables.forget(_pid);
    _run.sharedSpaces.forget({_pid, _startTime});
}

// By what was last seen of the thread.
bool LinuxTask::_chooseThread() {
    if (!_stat.threadEnded()) {
        return true;
    }
    LiveThread thread = openLiveThread(directory());
    _threadId = thread.directory ? thread.identifier : _pid;
    _thread = std::move(thread.directory);
    _stat = thread.stat;
    return static_cast<bool>(_thread);
}

// A text that a thread's end or its exec cuts short ends like any other, so the thread is looked at before
// and after: when it has ended another one is asked, when it runs another program the text is read again.
kern_return_t LinuxTask::_readMappings(Mappings& mappings) {
    constexpr int kAttempts = 5;
    for (int attempt = 0; attempt < kAttempts && _chooseThread(); ++attempt) {
        const bool read = _readMappingsOnce(mappings);
        if (!read && errno != ESRCH) {
            return KERN_FAILURE;
        }
        if (_runsTheSame() && read) {
            return mappings.vmas.empty() ? KERN_INVALID_ADDRESS : KERN_SUCCESS;
        }
    }
    return MACH_SEND_INVALID_DEST;
}

// Whether the thread lives and has not run another program since it was last looked at. Both show in auxv
// first, which costs less than half of `stat`.
bool LinuxTask::_runsTheSame() {
    if (_program != 0 && programOf(memoryDirectory(), _run.identity) == _program) {
        return true;
    }
    const procfs::ProcStat before = std::move(_stat);
    _stat = readStat(memoryDirectory()).value_or(endedThread());
    _program = programOf(memoryDirectory(), _run.identity);
    return !_stat.threadEnded() && _stat.isSameProgramAs(before);
}

// Asking the system for what smaps would tell pays off where much is measured.
bool LinuxTask::_countsPayOff(const procfs::ProcStatus& status) const {
    constexpr size_t kManyProcesses = 8;
    constexpr uint64_t kLargeProcess = 16U << 20U;
    return _run.mappingSource == MappingSource::cheapest &&
           (_run.forkCensus.measured() >= kManyProcesses ||
            status.rssAnon + status.rssFile + status.rssShmem >= kLargeProcess);
}

bool LinuxTask::_readMappingsOnce(Mappings& mappings) {
    const int directory = memoryDirectory();
    _pages.emplace(directory, PageFacts{_run.frames, zeroFrameOf(_run.untouchedPage), _run.pageSize});
    mappings.isAlone = _run.forkCensus.isAlone(_pid);
    mappings.filePages.reset();
    const auto current = status();
    if (current && _countsPayOff(*current)) {
        if (!procfs::readMappings(directory, "maps", mappings.texts)) {
            return false;
        }
        mappings.vmas = backedVmas(mappings.texts, _run.shmemDevices, directory);
        const PageScanner scan = [this](const PageScan& pages, std::span<ScannedRange> ranges,
                                        uint64_t& end) { return _pages->scan(pages, ranges, end); };
        mappings.filePages = countWithoutSmaps(mappings.vmas,
                                               {.memoryDirectory = directory,
                                                .status = *current,
                                                .scan = scan,
                                                .pages = *_pages,
                                                .pageSize = _run.pageSize,
                                                .isAlone = mappings.isAlone},
                                               _run.uncountedPages);
        if (mappings.filePages) {
            return true;
        }
    }
    if (!procfs::readMappings(directory, "smaps", mappings.texts)) {
        return false;
    }
    mappings.vmas = backedVmas(mappings.texts, _run.shmemDevices, directory);
    return true;
}

std::optional<procfs::ProcStatus> LinuxTask::status() {
    constexpr uint64_t kLongestLife = 50'000'000;
    const uint64_t now = monotonicNanoseconds();
    if (!_status || now - _statusTime > kLongestLife) {
        std::string text;
        const bool read = procfs::readRecord(memoryDirectory(), "status", text);
        _status = read ? std::optional(procfs::parseStatus(text)) : std::nullopt;
        _statusTime = now;
        if (_status) {
            _run.pageTables.set(_pid, _status->vmPte);
        }
    }
    return _status;
}

ForkFamily& LinuxTask::_family() {
    if (_forkFamily == nullptr) {
        _forkFamily = _run.families.family(
            forkFamilyIdentifier(_run.proc.get(), memoryDirectory(), _threadId, _run.identity));
    }
    return *_forkFamily;
}

kern_return_t LinuxTask::takeSnapshot() {
    // Where pages are missing the process may have ended since its mappings were read, or run another
    // program, which reading them again tells.
    for (const bool isLast : {false, true}) {
        if (const kern_return_t code = _space ? KERN_SUCCESS : _takeSnapshotOnce(); code != KERN_SUCCESS) {
            return code;
        }
        if (isLast || !_space->missesPages()) {
            break;
        }
        dropSnapshot();
    }
    return KERN_SUCCESS;
}

kern_return_t LinuxTask::_takeSnapshotOnce() {
    // Thousands of processes are looked at in turn: room for the mappings is made once for a thread.
    thread_local Mappings mappings;
    const kern_return_t code = _readMappings(mappings);
    if (code != KERN_SUCCESS) {
        return code;
    }
    std::optional<ScannedPages> scanned;
    if (mappings.filePages && mappings.isAlone) {
        scanned.emplace(*std::move(mappings.filePages), _run.pageSize);
    }
    PageSource& pages = scanned ? static_cast<PageSource&>(*scanned) : *_pages;
    const auto family = [this]() -> ForkFamily& { return _family(); };
    const ProcessIdentity owner = _run.sharedSpaces.ownerOf(_candidate());
    _space.emplace(mappings.vmas,
                   AddressSpaceOwner{.pid = owner.pid,
                                     .startTime = owner.startTime,
                                     .ipcNamespace = hasSysVSegments(mappings.vmas)
                                                         ? procfs::readNamespace(memoryDirectory(), "ipc")
                                                         : 0,
                                     .family = mappings.isAlone ? std::function<ForkFamily&()>() : family},
                   pages, AddressSpaceContext{_run.identity, _run.shmemDevices, _run.names, _run.pageSize});
    if (owner.pid == _pid) {
        _checkFamilyMemory();
    }
    mappings.forgetMany();
    // Whoever walks the regions keeps something of each.
    constexpr size_t kKeptOfRegion = 200;
    MWExpectAllocations(_space->regions().size() * kKeptOfRegion);
    return KERN_SUCCESS;
}

void LinuxTask::Mappings::forgetMany() {
    constexpr size_t kMany = 4096;
    if (texts.capacity() > kMany) {
        *this = {};
    }
}

// One generation is too few where a child rewrote memory and forked again: its frames are then joined with
// the ones that its parent still shares. The members' parts do add up to all of them.
void LinuxTask::_checkFamilyMemory() {
    const uint64_t part = _space->partOfFamilyMemory();
    if (part == 0 || _run.seesFrames()) {
        return;
    }
    ForkFamily& family = _family();
    family.setPart(_pid, part);
    const uint64_t joined = family.generations().pages() * _run.pageSize;
    const uint64_t parts = family.sumOfParts();
    constexpr uint64_t kTolerated = 1U << 20U;
    if (parts > joined + joined / 64 + kTolerated) {
        _warnings.push_back("Memory shared by fork may be under-counted by " +
                            std::to_string(parts - joined) + " bytes: page frames are hidden (try as root?)");
    }
}

bool LinuxTask::sharesAnothersSpace() {
    return _run.sharedSpaces.ownerOf(_candidate()).pid != _pid;
}

void LinuxTask::survey(bool withOwnedObjects) {
    _run.forkCensus.add(_pid, _exec);
    if (withOwnedObjects) {
        _surveyOwnedObjects();
    }
}

void LinuxTask::_surveyOwnedObjects() {
    _run.ownedObjects.add({_pid, _startTime}, memoryDirectory());
}

// An object is left to the region walk where that shows it. A mapping whose pages the process has not touched
// shows nothing.
std::vector<OwnedObjectRecord> LinuxTask::ownedObjects() {
    const ProcessIdentity process = {_pid, _startTime};
    if (!_run.ownedObjects.knows(process)) {
        _surveyOwnedObjects();
    }
    std::optional<std::unordered_set<uint64_t>> shown;
    return _run.ownedObjects.objectsOf(process, [&](uint64_t identifier) {
        if (!shown) {
            shown = _shownObjects();
        }
        return shown->contains(identifier);
    });
}

std::unordered_set<uint64_t> LinuxTask::_shownObjects() {
    std::unordered_set<uint64_t> shown;
    if (takeSnapshot() == KERN_SUCCESS) {
        for (const AddressSpaceRegion& region : _space->regions()) {
            shown.insert(region.info.object_id_full);
        }
    }
    return shown;
}

void LinuxTask::dropSnapshot() {
    _space.reset();
    _pages.reset();
    _entries = {};
    _holeStart = _holeEnd = 0;
}

// A file of a terabyte of which three pages are mapped is asked about only where it has some.
bool LinuxTask::_isHole(const AddressSpaceRegion& region, uint64_t start, uint64_t end) {
    if (region.isSparse(_run.pageSize) && (start < _holeStart || start >= _holeEnd)) {
        _holeStart = start;
        _holeEnd = _pages->nextPopulated(start, region.end());
    }
    return start >= _holeStart && end <= _holeEnd;
}

// The pages from `address` on, as many as there are entries, all of them in the region.
bool LinuxTask::_readEntries(const AddressSpaceRegion& region, uint64_t address) {
    if (!_pages->readPages(address, _entries)) {
        return false;
    }
    if (region.backing == Backing::anonymous) {
        _pages->clearZeroPages(address, _entries);
    }
    return true;
}

kern_return_t LinuxTask::fillDispositions(uint64_t start, std::span<int32_t> words) {
    std::fill(words.begin(), words.end(), 0);
    const uint64_t end = start + words.size() * _run.pageSize;
    const AddressSpaceRegion* region = _space->regionAtOrAbove(start);
    const AddressSpaceRegion* const last = _space->regions().data() + _space->regions().size();
    for (; region != nullptr && region != last && region->start < end; ++region) {
        const uint64_t from = std::max(start, region->start);
        const uint64_t to = std::min(end, region->end());
        const uint64_t pages = (to - from) / _run.pageSize;
        const auto wordsOfPart = words.subspan((from - start) / _run.pageSize, pages);
        if (_isHole(*region, from, to)) {
            _dispositions.fillHole(*region, from, _run.pageSize, wordsOfPart);
            continue;
        }
        _entries.resize(pages);
        if (!_readEntries(*region, from)) {
            return KERN_INVALID_ARGUMENT;
        }
        _dispositions.fill(*region, from, _entries, _run.frames, _run.pageSize, wordsOfPart);
    }
    return KERN_SUCCESS;
}
