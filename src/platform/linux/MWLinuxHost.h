#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/MWHostInterface.h"
#include "platform/linux/KernelSymbols.h"
#include "platform/linux/LinuxTask.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

/// The live answer: Linux processes, measured through procfs (5.10 and newer).
///
/// A task holds its process's directory open, so that everything asked through it is about that process even
/// when its pid is given away. One walk sees one snapshot of the address space: the first question about
/// regions takes it, the answer that the end was reached drops it.
class MWLinuxHost : public MWHostInterface {
public:
    /// `procDirectory` is the root of a procfs, or of a tree of recorded files; `sysDirectory` that of a
    /// sysfs.
    explicit MWLinuxHost(const std::string& procDirectory = "/proc", const std::string& sysDirectory = "/sys",
                         MappingSource mappingSource = MappingSource::cheapest);
    ~MWLinuxHost() override;
    MWLinuxHost(const MWLinuxHost&) = delete;
    MWLinuxHost& operator=(const MWLinuxHost&) = delete;

    kern_return_t task_read_for_pid(int32_t pid, task_t& task) override;
    void task_release(task_t task) override;
    /// Linux has none.
    bool hasSharedCache(task_t task) override;

    kern_return_t mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t& depth,
                                         vm_region_submap_info_64& info, uint32_t& count) override;
    std::vector<std::string> takeTaskWarnings(task_t task) override;
    kern_return_t mach_vm_region(task_t task, uint64_t& address, uint64_t& size,
                                 vm_region_basic_info_64& info, uint32_t& count) override;
    /// Nothing on Linux is purgeable: always VM_PURGABLE_DENY.
    kern_return_t mach_vm_purgable_control(task_t task, uint64_t address, int32_t control,
                                           int32_t& state) override;
    kern_return_t mach_vm_page_range_query(task_t task, uint64_t start, uint64_t length,
                                           std::span<int32_t> dispositions, uint64_t& count) override;
    int proc_regionfilename(int32_t pid, uint64_t address, std::span<char> path) override;

    int proc_pidinfo(int32_t pid, proc_bsdshortinfo& record) override;
    int proc_pidinfo(int32_t pid, proc_bsdinfo& record) override;
    /// With kernel threads, which have no record: they are the kernel, which is pid 0.
    int proc_listallpids(std::span<int32_t> pids) override;
    /// Charge: RssAnon + RssShmem + VmSwap + VmPTE + HugetlbPages of `status`. Peak: the larger of that and
    /// VmHWM, which includes clean file pages.
    int proc_pid_rusage(int32_t pid, rusage_info_v5& record) override;
    /// Linux tracks none: the flags are 0.
    int proc_get_dirty(int32_t pid, uint32_t& flags) override;
    int sysctlArgumentMaximum(uint64_t& bytes) override;
    int sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) override;

    /// One entry, "page_table"; its balance is VmPTE, or 0 where another process is charged for the space.
    int ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) override;
    int ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) override;

    void beginSurvey() override;
    void surveyTask(task_t task, bool withOwnedVmObjects) override;
    void surveySavedProcess() override;
    /// What the process holds through descriptors, and its SysV segments that nobody has attached.
    int sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) override;
    int sysctlSelfRegionMemweight(int32_t& value) override;
    int setSysctlSelfRegionMemweight(int32_t value) override;
    /// KERN_FAILURE when nothing can be read, which without privilege `meminfo` still can.
    kern_return_t mach_memory_info(MWKernelMemoryArrays& arrays) override;
    /// KERN_INVALID_ARGUMENT for what is no array, whole, from here.
    kern_return_t vm_deallocate(const void* address, size_t size) override;
    /// Those that the last answer about the kernel's memory has records of: load tags are places in a list
    /// that changes.
    std::vector<MWKernelExtension> loadedKernelExtensions() override;
    std::unique_ptr<KernelSymbolicator> makeKernelSymbolicator() override;

    uint64_t vm_kernel_page_size() override { return _run.pageSize; }
    std::string mach_error_string(kern_return_t code) override;
    void mach_error(std::string_view label, kern_return_t code) override;

    std::optional<std::string> describeRegionTypeForTag(uint32_t tag) override;
    uint32_t tagForRegionType(const std::string& name) override { return _run.names.tagForName(name); }
    /// From the task's snapshot, which is taken when there is none: the walk that follows goes on with it.
    void forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) override;

    int mach_get_times(MWClockReading& reading) override;
    mach_timebase_info_t mach_timebase_info() override;
    uint64_t uptimeNanoseconds() override;
    std::unique_ptr<MWTimer> makeTimer(MWSerialQueue& queue, std::function<void(uint64_t)> handler) override;

    int32_t getpid() override;
    uint32_t geteuid() override;
    bool isatty(int descriptor) override;
    bool fileExists(const std::string& path) override;
    void unlinkRegularFile(const std::string& path) override;

private:
    void _forgetListed();
    std::optional<ListedProcess> _takeListed(int32_t pid);
    LinuxTask* _task(task_t task);
    LinuxTask* _taskOfPid(int32_t pid);
    LinuxTask* _newestTaskOfPid(int32_t pid) const;
    /// From the task's snapshot, which is taken when there is none; `code` says why there is no region.
    const AddressSpaceRegion* _regionAtOrAbove(task_t task, uint64_t address, kern_return_t& code);
    /// The process's directory: the one that a task of this pid holds open, else opened anew into `opened`.
    int _processDirectory(int32_t pid, procfs::Descriptor& opened);
    /// A record of a process; false with errno on failure, ESRCH when the process is gone.
    bool _readProcessFile(int32_t pid, const char* name, std::string& text);
    std::optional<procfs::ProcStat> _statOfPid(int32_t pid);
    /// Empty with errno where it is hidden.
    std::string _executableOfPid(int32_t pid);
    std::optional<procfs::ProcStatus> _memoryStatusOfPid(int32_t pid);

    /// A copy that the caller gives back.
    template <class Record>
    std::span<const Record> _handOver(const std::vector<Record>& records);

    std::atomic<uint64_t> _tasksGeneration;  ///< changes when the tables of tasks do
    LinuxRun _run;
    procfs::Descriptor _sys;
    std::atomic<int32_t> _selfRegionMemweight = 0;

    std::mutex _listedMutex;  ///< guards what follows
    std::map<int32_t, ListedProcess> _listed;
    std::vector<int32_t> _listedPids;  ///< whose number was told and which are to be told next

    std::mutex _tasksMutex;  ///< guards the table; a task itself is one thread's at a time
    std::map<task_t, std::unique_ptr<LinuxTask>> _tasks;
    std::set<std::pair<int32_t, task_t>> _tasksByPid;
    task_t _lastTask = 0;

    struct KernelArray {
        size_t size;
        std::shared_ptr<void> memory;
    };
    std::mutex _kernelMutex;  ///< guards what follows
    std::map<const void*, KernelArray> _kernelArrays;
    // Of the last answer about the kernel's memory.
    std::vector<MWKernelExtension> _kernelModules;
    std::shared_ptr<const KernelSourceLocations> _kernelSourceLocations;
};
