#pragma once

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <semaphore>
#include <set>
#include <string>
#include <vector>

#include "platform/MWHostInterface.h"
#include "platform/MWWorkQueue.h"

class FakeHost;

/// A region as a test writes it down; `pages` are the disposition words of its pages, missing ones are 0.
struct FakeRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    vm_region_submap_info_64 info = {};
    std::string path = {};
    std::vector<int32_t> pages = {};
    int32_t purgeState = VM_PURGABLE_DENY;
    bool purgeQueryFails = false;
    uint32_t words = VM_REGION_SUBMAP_INFO_COUNT_64;
};

struct FakeImage {
    std::string path;
    uint64_t baseAddress = 0;
    std::vector<MWImageSegmentDescription> segments = {};
};

struct FakeProcess {
    int32_t parent = 1;
    std::string comm = {};
    std::string name = {};
    std::string executable = {};  ///< path in the argument area; empty: the area cannot be read
    uint32_t flags = PROC_FLAG_LP64;
    uint32_t status = 2;
    bool refused = false;  ///< task_read_for_pid fails
    std::vector<FakeRegion> regions = {};
    std::vector<FakeImage> images = {};
    /// What the walk answers once `regionsBeforeFailure` regions were delivered, when not KERN_SUCCESS.
    kern_return_t walkFailure = KERN_SUCCESS;
    size_t regionsBeforeFailure = 0;
    uint64_t mappingFailureFrom = UINT64_MAX;  ///< from here on mach_vm_region fails
    kern_return_t pageQueryFailure = KERN_SUCCESS;
    bool gone = false;  ///< proc_pidinfo fails with ESRCH
    uint32_t dirtyFlags = 0;
    uint64_t startTime = 0;  ///< seconds
    std::optional<rusage_info_v5> usage = {};
    std::vector<int64_t> ledgerBalances = {};
    int ledgerError = 0;                        ///< errno of the entry query, 0 for success
    std::vector<OwnedObjectRecord> owned = {};  ///< the reply; empty for one of no bytes
    std::optional<size_t> ownedAtFirst = {};    ///< how many the length query knows of; all
    int ownedError = ENOENT;                    ///< errno of both queries, 0 for success
    int ownedFetchError = 0;
};

/// A timer that fires when the test says so.
class FakeTimer : public MWTimer {
public:
    FakeTimer(FakeHost& host, MWSerialQueue& queue, std::function<void(uint64_t)> handler);
    ~FakeTimer() override;
    FakeTimer(const FakeTimer&) = delete;
    FakeTimer& operator=(const FakeTimer&) = delete;

    void arm(const MWTimerSchedule& schedule) override;
    void cancel() override { _isCancelled = true; }
    bool fire(uint64_t fires);

private:
    FakeHost& _host;
    MWSerialQueue& _queue;
    std::function<void(uint64_t)> _handler;
    std::atomic<bool> _isCancelled = false;
};

/// The system on a page: a test fills `processes` and reads back what was asked. Installs itself as the
/// current host for its lifetime.
class FakeHost : public MWHostInterface {
public:
    FakeHost();
    ~FakeHost() override;
    FakeHost(const FakeHost&) = delete;
    FakeHost& operator=(const FakeHost&) = delete;

    std::map<int32_t, FakeProcess> processes;
    uint64_t pageSize = 4096;
    bool sharedCache = false;
    int32_t selfRegionMemweight = 0;
    int selfRegionMemweightError = 0;  ///< errno of both accesses, 0 for success
    bool processListFails = false;
    MWClockReading clock = {1000, 2000, 978307200, 500000000};
    bool clockFails = false;
    std::atomic<uint64_t> uptime = 1000;  ///< nanoseconds
    bool noTimers = false;
    std::vector<MWTimerSchedule> schedules;  ///< of each arming
    std::binary_semaphore timerArmed = std::binary_semaphore(0);
    int32_t ownPid = 99999;
    uint32_t effectiveUser = 0;
    std::set<int> terminals;
    std::set<std::string> files;  ///< existing paths
    std::map<uint32_t, std::string> tagDescriptions;
    std::map<std::string, uint32_t> tagsOfNames;

    std::vector<std::string> ledgerNames;
    int ledgerTemplateError = 0;
    bool ownedReplyIsCut = false;      ///< it is shorter than its count says
    bool ownedReplyIsEndless = false;  ///< it fills any buffer

    std::vector<std::pair<std::string, mach_zone_info_t>> kernelZones;
    std::vector<mach_memory_info_t> kernelRecords;
    std::vector<MWKernelExtension> kernelExtensions;
    std::map<uint64_t, std::string> kernelSymbols;  ///< by address
    std::map<uint64_t, KernelSymbolicator::SourceLocation> kernelLocations;
    kern_return_t kernelMemoryResult = KERN_SUCCESS;
    kern_return_t deallocationResult = KERN_SUCCESS;

    std::vector<std::string> unlinked;
    std::vector<size_t> deallocated;      ///< bytes, in the order in which they were given back
    std::map<task_t, bool> surveyed;      ///< since the last survey began: whether with owned objects
    size_t savedProcessesSurveyed = 0;    ///< ever
    std::vector<size_t> ownedFetches;     ///< room of each fetch of owned objects, in bytes
    std::vector<std::string> machErrors;  ///< "LABEL: CODE" of each mach_error
    std::vector<std::pair<uint64_t, uint64_t>> pageQueries;  ///< (start, pages) of each page-range query
    std::set<task_t> openTasks;
    /// Returns when the timer's handler has run; false when there is no timer or it is cancelled.
    bool fireTimer(uint64_t fires = 1);
    /// How often the operation of this name was asked.
    int asked(const std::string& operation) const;

    kern_return_t task_read_for_pid(int32_t pid, task_t& task) override;
    void task_release(task_t task) override;
    bool hasSharedCache(task_t) override { return sharedCache; }
    kern_return_t mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t& depth,
                                         vm_region_submap_info_64& info, uint32_t& count) override;
    kern_return_t mach_vm_region(task_t task, uint64_t& address, uint64_t& size,
                                 vm_region_basic_info_64& info, uint32_t& count) override;
    kern_return_t mach_vm_purgable_control(task_t task, uint64_t address, int32_t control,
                                           int32_t& state) override;
    kern_return_t mach_vm_page_range_query(task_t task, uint64_t start, uint64_t length,
                                           std::span<int32_t> dispositions, uint64_t& count) override;
    int proc_regionfilename(int32_t pid, uint64_t address, std::span<char> path) override;
    int proc_pidinfo(int32_t pid, proc_bsdshortinfo& record) override;
    int proc_pidinfo(int32_t pid, proc_bsdinfo& record) override;
    int proc_listallpids(std::span<int32_t> pids) override;
    int proc_pid_rusage(int32_t pid, rusage_info_v5& record) override;
    int proc_get_dirty(int32_t pid, uint32_t& flags) override;
    int sysctlArgumentMaximum(uint64_t& bytes) override {
        bytes = 4096;
        return 0;
    }
    int sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) override;
    int ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) override;
    int ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) override;
    void beginSurvey() override { surveyed.clear(); }
    void surveyTask(task_t task, bool withOwnedVmObjects) override;
    void surveySavedProcess() override { ++savedProcessesSurveyed; }
    int sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) override;
    int sysctlSelfRegionMemweight(int32_t& value) override;
    int setSysctlSelfRegionMemweight(int32_t value) override;
    kern_return_t mach_memory_info(MWKernelMemoryArrays& arrays) override;
    kern_return_t vm_deallocate(const void* address, size_t size) override;
    std::vector<MWKernelExtension> loadedKernelExtensions() override { return kernelExtensions; }
    std::unique_ptr<KernelSymbolicator> makeKernelSymbolicator() override;
    uint64_t vm_kernel_page_size() override { return pageSize; }
    std::string mach_error_string(kern_return_t code) override { return "code " + std::to_string(code); }
    void mach_error(std::string_view label, kern_return_t code) override;
    std::optional<std::string> describeRegionTypeForTag(uint32_t tag) override;
    uint32_t tagForRegionType(const std::string& name) override { return tagsOfNames[name]; }
    void forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) override;
    int mach_get_times(MWClockReading& reading) override {
        reading = clockFails ? reading : clock;
        return clockFails ? -1 : 0;
    }
    mach_timebase_info_t mach_timebase_info() override { return {1, 1}; }
    uint64_t uptimeNanoseconds() override { return uptime; }
    std::unique_ptr<MWTimer> makeTimer(MWSerialQueue& queue, std::function<void(uint64_t)> handler) override;
    int32_t getpid() override { return ownPid; }
    uint32_t geteuid() override { return effectiveUser; }
    bool isatty(int descriptor) override { return terminals.contains(descriptor); }
    bool fileExists(const std::string& path) override { return files.contains(path); }
    void unlinkRegularFile(const std::string& path) override { unlinked.push_back(path); }

private:
    void _count(const std::string& operation);
    /// Sets errno and returns what a failing BSD-style operation does.
    static int _fail(int error);
    /// None, and errno ESRCH, when there is no such process (any more).
    const FakeProcess* _find(int32_t pid);
    const FakeRegion* _regionAtOrAbove(task_t task, uint64_t address);

    MWHostInterface* _previous;
    mutable std::mutex _mutex;  ///< guards what is remembered; gathering asks from several threads
    std::map<std::string, int> _asked;
    std::map<task_t, size_t> _delivered;
    std::vector<mach_zone_name_t> _zoneNames;
    std::vector<mach_zone_info_t> _zones;

    friend class FakeTimer;
    std::mutex _timerMutex;
    FakeTimer* _timer = nullptr;  ///< while there is one
};
