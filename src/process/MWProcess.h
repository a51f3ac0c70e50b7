#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "model/MWAuxData.h"
#include "model/MWMemoryObject.h"
#include "model/MWRegionHolder.h"
#include "platform/MWHostRecords.h"

class MWProcess;

enum MWIdleExitStatus : int32_t {
    IdleExitUnknown = 0,
    IdleExitIneligible = 1,  ///< not tracked for idle exit, or tracked but not allowed to
    IdleExitClean = 2,
    IdleExitDirty = 3,
};

/// Processes by pid; a process that comes from a file has a key that is no pid (negative).
using MWTargetMap = std::map<int64_t, std::shared_ptr<MWProcess>>;
/// Pid to the name that selected it; none for a pid that came as a number.
using MWPidMap = std::map<int32_t, std::optional<std::string>>;

/// The base of every process source. Identity is the pid. Created with its identity, then gathered once by
/// one thread; messages accumulate and are never removed.
class MWProcess : public MWRegionHolder {
public:
    ~MWProcess() override = default;
    MWProcess(const MWProcess&) = delete;
    MWProcess& operator=(const MWProcess&) = delete;

    int32_t pid() const override { return _pid; }
    void setPid(int32_t pid) { _pid = pid; }
    bool is64bit() const { return _is64bit; }
    void setIs64bit(bool is64bit) { _is64bit = is64bit; }
    /// The process runs under binary translation.
    bool isTranslated() const { return _isTranslated; }
    void setIsTranslated(bool isTranslated) { _isTranslated = isTranslated; }
    MWIdleExitStatus idleExitStatus() const { return _idleExitStatus; }
    /// Gathered only to find memory that it shares with the targets.
    bool hiddenFromDisplay() const { return _hiddenFromDisplay; }
    void setHiddenFromDisplay(bool hidden) { _hiddenFromDisplay = hidden; }
    const std::string& name() const { return _name; }
    void setName(std::string name) { _name = std::move(name); }
    /// Absent until gathered.
    const std::optional<MWMemoryRegionList>& memoryRegions() const { return _memoryRegions; }
    void setMemoryRegions(MWMemoryRegionList regions) { _memoryRegions = std::move(regions); }
    /// "NAME [PID]"
    const std::string& displayString() const { return _displayString; }
    void setDisplayString(std::string displayString) { _displayString = std::move(displayString); }
    uint64_t pageSize() const override { return _pageSize; }
    void setPageSize(uint64_t pageSize) { _pageSize = pageSize; }

    /// Messages that make the process's data unreliable; a snapshot.
    std::vector<std::string> errors() const { return _errors; }
    /// Messages that the user should see but that do not spoil the data.
    const std::vector<std::string>& warnings() const { return _warnings; }
    /// Messages about the whole run.
    const std::vector<std::string>& globalErrors() const { return _globalErrors; }
    void _addGlobalError(std::string message) { _globalErrors.push_back(std::move(message)); }

    int64_t hash() const { return _pid; }
    bool isEqual(const MWProcess& other) const { return other._pid == _pid; }
    /// The pid, as the key of maps from process to anything.
    int64_t asNumber() const { return _pid; }
    /// "MWProcess[PID]"
    std::string description() const;

    virtual uint64_t _gatherPageSize();
    /// Acquires what the source needs to read the process; false when it may not.
    virtual bool _populateTask() { return false; }
    /// Whatever has to be known of all processes before the first of them is gathered.
    virtual void prepareToGatherData() {}
    /// Whether gathering takes far longer than that of an ordinary process.
    virtual bool takesLongToGather() const { return false; }
    /// Fills `memoryRegions` and the other gathered data.
    virtual void gatherData() {}
    /// None when the process has no auxiliary data.
    virtual MWAuxDataTree auxData() const;
    /// Whether the process can still be asked for live data.
    virtual bool _isAlive() const { return false; }
    bool breakDownPhysMemweight() const override;

    // Class operations: from descriptions and pids to processes. Each takes its own snapshot of the system's
    // process list; "none" means that the list could not be read.

    /// None unless the process exists and can be read.
    static std::shared_ptr<MWProcess> processWithPid(int32_t pid);
    /// None when the source cannot be made, for example when the kernel refuses access.
    static std::shared_ptr<MWProcess> processWithBsdInfo(const proc_bsdinfo& info);
    /// The file name of the process's executable, or where that cannot be read `_nameForBsdInfoCommName`.
    static std::string _nameForBsdInfo(const proc_bsdinfo& info);
    /// `pbi_name`, or when that is empty `pbi_comm`, or "Unknown".
    static std::string _nameForBsdInfoCommName(const proc_bsdinfo& info);
    static std::optional<MWTargetMap> allProcessesExcludingPids(const std::set<int32_t>& excludedPids);
    /// Every process whose name, or the one whose pid, each description is. Appends a message for each
    /// description that matched nothing to `errors`, which may be null.
    static std::optional<MWPidMap> pidsForStringDescriptions(const std::vector<std::string>& descriptions,
                                                             std::vector<std::string>* errors);
    /// The given pids, then all their descendants by generation, each once.
    static std::optional<std::vector<int32_t>> childPidsForPids(const std::vector<int32_t>& pids);
    /// A copy without the processes whose idle-exit status is IdleExitClean.
    static MWTargetMap removeIdleExitCleanProcessesFrom(const MWTargetMap& processes);

protected:
    MWProcess() = default;

    /// Takes identity, name and page size from the record and acquires the task; false where that is refused.
    /// `pid` may be set before. (The failing half of initWithBsdInfo:)
    virtual bool _initWithBsdInfo(const proc_bsdinfo& info);
    void _setIdleExitStatus(MWIdleExitStatus status) { _idleExitStatus = status; }
    void _addError(std::string message) { _errors.push_back(std::move(message)); }
    void _addWarning(std::string message) { _warnings.push_back(std::move(message)); }

private:
    int32_t _pid = 0;
    bool _is64bit = false;
    bool _isTranslated = false;
    MWIdleExitStatus _idleExitStatus = IdleExitUnknown;
    std::vector<std::string> _errors;
    std::vector<std::string> _warnings;
    std::vector<std::string> _globalErrors;
    bool _hiddenFromDisplay = false;
    std::string _name;
    std::optional<MWMemoryRegionList> _memoryRegions;
    std::string _displayString;
    uint64_t _pageSize = 0;
};
