#include "platform/linux/OwnedObjectSurvey.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <ctime>
#include <string>

#include "platform/linux/LinuxTask.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"
#include "platform/linux/SmapsParser.h"

namespace {

uint64_t secondsOf(clockid_t clock) {
    timespec time = {};
    clock_gettime(clock, &time);
    return static_cast<uint64_t>(time.tv_sec);
}

// A creator's pid can have been given to another process since, which is then younger than the segment. One
// that seems older than the system was made before the clock was set.
bool canHaveMade(const ProcessIdentity& process, const procfs::SysVSegment& segment) {
    constexpr uint64_t kRounding = 2;
    const auto ticksPerSecond = static_cast<uint64_t>(sysconf(_SC_CLK_TCK));
    const uint64_t booted = secondsOf(CLOCK_REALTIME) - secondsOf(CLOCK_BOOTTIME);
    return process.pid == segment.creator &&
           (booted + process.startTime / ticksPerSecond <= segment.changeTime + kRounding ||
            segment.changeTime < booted);
}

bool isStill(const ProcessIdentity& process, int directory) {
    std::string text;
    const auto stat = procfs::readFile(directory, "stat", text) ? procfs::parseStat(text) : std::nullopt;
    return stat && stat->startTime == process.startTime;
}

// Those of a thread that lives where the first one has ended.
std::vector<procfs::Vma> mappingsOf(int processDirectory) {
    std::vector<procfs::Vma> vmas;
    procfs::readMappings(processDirectory, "smaps", vmas);
    if (vmas.empty()) {
        procfs::readMappings(openLiveThread(processDirectory).directory.get(), "smaps", vmas);
    }
    return vmas;
}

}  // namespace

void OwnedObjectSurvey::begin() {
    const std::lock_guard lock(_mutex);
    _holdersOfObject.clear();
    _holders.clear();
    _mappedFiles.clear();
    _segments.reset();
    _targets = std::make_shared<DescriptorTargets>(_system.shmemDevices);
}

void OwnedObjectSurvey::add(const ProcessIdentity& process, int directory) {
    const std::shared_ptr<DescriptorTargets> targets = [this] {
        const std::lock_guard lock(_mutex);
        return _targets;
    }();
    HeldObjects objects = heldObjects(directory, {*targets, _system.identity, _system.pageSize});
    const std::lock_guard lock(_mutex);
    _addSysVSegments(process, objects);
    const auto [known, isNew] = _holders.try_emplace(process, std::move(objects));
    if (!isNew) {
        return;
    }
    for (const auto& [identifier, object] : known->second) {
        _holdersOfObject[identifier].push_back(process);
    }
}

bool OwnedObjectSurvey::knows(const ProcessIdentity& process) const {
    const std::lock_guard lock(_mutex);
    return _holders.contains(process);
}

void OwnedObjectSurvey::_readSysVSegments() {
    constexpr size_t kLongestList = 64U << 20U;
    std::string text;
    procfs::readFile(_system.proc, "sysvipc/shm", text, kLongestList);
    _segments = procfs::parseSysVSegments(text);
    _ipcNamespace = procfs::readNamespace(procfs::open(_system.proc, "self", O_PATH).get(), "ipc");
}

void OwnedObjectSurvey::_addSysVSegments(const ProcessIdentity& process, HeldObjects& objects) {
    if (!_segments) {
        _readSysVSegments();
    }
    for (const procfs::SysVSegment& segment : *_segments) {
        if (segment.attached != 0 || segment.resident + segment.swapped == 0 ||
            !canHaveMade(process, segment)) {
            continue;
        }
        const OwnedObjectRecord record = {
            .object_id = _system.identity.sysV(_system.shmemDevices.internalDevice(), segment.identifier,
                                               _ipcNamespace),
            .virtual_size = segment.size,
            .resident = segment.resident,
            .compressed = segment.swapped,
            .flags = OwnedObjectRecord::flagsFor(MWLedgerDefault, VM_PURGABLE_DENY)};
        objects.emplace(record.object_id, HeldObject{.record = record});
    }
}

// Whether the walk of `process` shows the file. Not under the lock: to read mappings takes time, and can take
// for ever.
bool OwnedObjectSurvey::_maps(const ProcessIdentity& process, const HeldObject& object) {
    std::shared_ptr<MappedFiles> files;
    {
        const std::lock_guard lock(_mutex);
        files = _mappedFiles[process];
    }
    if (files == nullptr) {
        files = std::make_shared<MappedFiles>(_mappedFilesOf(process));
        const std::lock_guard lock(_mutex);
        _mappedFiles[process] = files;
    }
    return files->contains({object.device, object.inode});
}

OwnedObjectSurvey::MappedFiles OwnedObjectSurvey::_mappedFilesOf(const ProcessIdentity& process) const {
    const procfs::Descriptor directory =
        procfs::open(_system.proc, std::to_string(process.pid).c_str(), O_PATH | O_DIRECTORY);
    std::vector<procfs::Vma> vmas;
    if (directory && isStill(process, directory.get())) {
        vmas = mappingsOf(directory.get());
    }
    MappedFiles files;
    for (const procfs::Vma& vma : vmas) {
        if (vma.resident() + vma.swap != 0) {
            files.emplace(vma.device(), vma.inode);
        }
    }
    return files;
}

// The objects that the process holds, with the others that hold them, if it is the oldest of all.
std::vector<OwnedObjectSurvey::Candidate> OwnedObjectSurvey::_candidatesOf(const ProcessIdentity& process) {
    const std::lock_guard lock(_mutex);
    const auto found = _holders.find(process);
    if (found == _holders.end()) {
        return {};
    }
    std::vector<Candidate> candidates;
    for (const auto& [identifier, object] : found->second) {
        const std::vector<ProcessIdentity>& holders = _holdersOfObject[identifier];
        const bool isOldest = std::ranges::none_of(
            holders, [&](const ProcessIdentity& holder) { return ByIdentity()(holder, process); });
        if (isOldest) {
            candidates.push_back({object, holders});
        }
    }
    return candidates;
}

std::vector<OwnedObjectRecord> OwnedObjectSurvey::objectsOf(const ProcessIdentity& process,
                                                            const IsMapped& isMapped) {
    std::vector<OwnedObjectRecord> records;
    uint64_t socketBytes = 0;
    for (const auto& [object, holders] : _candidatesOf(process)) {
        const auto mapsIt = [&, held = &object](const ProcessIdentity& other) {
            return other == process ? isMapped(held->record.object_id) : _maps(other, *held);
        };
        if (object.canBeMapped() && std::ranges::any_of(holders, mapsIt)) {
            continue;
        }
        if (object.isSocket()) {
            socketBytes += object.record.resident;
        } else {
            records.push_back(object.record);
        }
    }
    if (socketBytes != 0) {
        records.push_back(
            {.object_id = _system.identity.unmapped(ObjectIdentity::Unmapped::socketsOfProcess,
                                                    static_cast<uint64_t>(process.pid), process.startTime),
             .virtual_size = socketBytes,
             .resident = socketBytes,
             .flags = OwnedObjectRecord::flagsFor(MWLedgerNetwork, VM_PURGABLE_DENY)});
    }
    return records;
}
