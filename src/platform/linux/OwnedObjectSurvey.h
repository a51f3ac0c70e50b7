#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/MWHostRecords.h"
#include "platform/linux/HeldObjects.h"
#include "platform/linux/SharedAddressSpaces.h"
#include "platform/linux/SysVSegments.h"

/// Decides which process is charged for an object that no mapping shows: the oldest of those that hold it,
/// unless one of them maps it; a SysV segment that nobody has attached is its creator's. For this the
/// processes of a measurement are looked at before the first of them is asked about. Safe for use from
/// several threads.
class OwnedObjectSurvey {
public:
    struct System {
        int proc;
        uint64_t pageSize;
        const ShmemDevices& shmemDevices;
        const ObjectIdentity& identity;
    };
    /// The system outlives the survey.
    explicit OwnedObjectSurvey(const System& system) : _system(system) { begin(); }

    /// Forgets what was found: what processes hold changes.
    void begin();
    /// Looks at what the process holds; `directory` is where its descriptors are.
    void add(const ProcessIdentity& process, int directory);
    bool knows(const ProcessIdentity& process) const;

    /// Whether the region walk of the process itself shows the object; asked of files only.
    using IsMapped = std::function<bool(uint64_t identifier)>;
    /// What is reported for a process that was added: an entry for each object, one for all its sockets.
    std::vector<OwnedObjectRecord> objectsOf(const ProcessIdentity& process, const IsMapped& isMapped);

private:
    /// Device and inode of those that the walk of a process shows, which it does not for untouched mappings.
    using MappedFiles = std::set<std::pair<uint64_t, uint64_t>>;
    struct Candidate {
        HeldObject object;
        std::vector<ProcessIdentity> holders;  ///< all of them
    };
    struct ByIdentity {
        bool operator()(const ProcessIdentity& one, const ProcessIdentity& other) const {
            return std::pair(one.startTime, one.pid) < std::pair(other.startTime, other.pid);
        }
    };

    void _readSysVSegments();
    void _addSysVSegments(const ProcessIdentity& process, HeldObjects& objects);
    std::vector<Candidate> _candidatesOf(const ProcessIdentity& process);
    bool _maps(const ProcessIdentity& process, const HeldObject& object);
    MappedFiles _mappedFilesOf(const ProcessIdentity& process) const;

    System _system;

    mutable std::mutex _mutex;  ///< guards what follows
    /// Replaced when a survey begins; one that was given up in the last one keeps the old.
    std::shared_ptr<DescriptorTargets> _targets;
    /// Of the tool's own IPC namespace.
    std::optional<std::vector<procfs::SysVSegment>> _segments;
    uint64_t _ipcNamespace = 0;
    std::map<ProcessIdentity, HeldObjects, ByIdentity> _holders;
    std::unordered_map<uint64_t, std::vector<ProcessIdentity>> _holdersOfObject;
    std::map<ProcessIdentity, std::shared_ptr<MappedFiles>, ByIdentity>
        _mappedFiles;  ///< as they are asked for
};
