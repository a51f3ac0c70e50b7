#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/MWHostRecords.h"
#include "platform/MWLedgerTable.h"
#include "platform/MWTimer.h"

class MWSerialQueue;

/// One segment of a loaded image, as the image-listing service names it.
struct MWImageSegmentDescription {
    std::string name;
    uint64_t start = 0;
    uint64_t length = 0;
};

/// One loaded image; `segments` is a cursor: each call walks the image's segments anew.
class MWImageDescription {
public:
    virtual ~MWImageDescription() = default;
    /// Free of symbolic links: the file as the host finds it mapped. The program itself never looks a path of
    /// another process up: that would cost a walk through the file system for each image of each process, and
    /// in its own mount namespace, where the path may lead elsewhere.
    virtual std::string path() const = 0;
    virtual uint64_t baseAddress() const = 0;
    virtual void forEachSegment(const std::function<void(const MWImageSegmentDescription&)>& block) const = 0;
};

/// Names for addresses of the running kernel, from its symbol tables alone. Lives for one gathering.
class KernelSymbolicator {
public:
    struct SourceLocation {
        std::string path;
        int line = 0;
    };

    virtual ~KernelSymbolicator() = default;
    /// The symbol that contains the address, if one does.
    virtual std::optional<std::string> nameForAddress(uint64_t address) = 0;
    virtual std::optional<SourceLocation> sourceLocationForAddress(uint64_t address) = 0;
};

/// A piece of code that was loaded into the running kernel.
struct MWKernelExtension {
    uint64_t OSBundleLoadTag = 0;
    std::string bundleIdentifier;
};

/// The answer to mach_memory_info. The arrays are the caller's, who gives each back with vm_deallocate.
struct MWKernelMemoryArrays {
    std::span<const mach_zone_name_t> zoneNames;
    std::span<const mach_zone_info_t> zones;
    std::span<const mach_memory_info_t> records;
};

/// Everything that the program asks of the system, clocks included. The live answer is MWLinuxHost; tests
/// answer from regions and processes that they write down.
///
/// Failures come back as the operation's return code (kern_return_t, 0 is success) or as a negative number
/// with `errno` set (the BSD-style operations); nothing is printed, but for `mach_error`. All operations may
/// be called from several threads at once for different processes; one process is asked about by one thread
/// at a time.
class MWHostInterface {
public:
    /// The host that the program runs against. There is exactly one at a time: the program installs the live
    /// one first thing, a test installs its own. Asking without one is an invariant violation.
    static MWHostInterface& current();
    /// Installs `host` (not owned; none to uninstall) and returns the one installed before.
    static MWHostInterface* setCurrent(MWHostInterface* host);

    virtual ~MWHostInterface() = default;

    // Tasks.

    /// Read access to a process. Everything asked through `task` is about the process that has the pid now,
    /// even when the pid is given to another one later. Fails with KERN_FAILURE where the caller may not
    /// look.
    virtual kern_return_t task_read_for_pid(int32_t pid, task_t& task) = 0;
    /// Gives the handle back; the process object that acquired it calls this once.
    virtual void task_release(task_t task) = 0;
    /// Whether processes of this system have an rtld shared cache at fixed addresses.
    virtual bool hasSharedCache(task_t task) = 0;

    // Regions.

    /// The first region at or above `address`; sets address, size, `info` and the number of words filled.
    /// KERN_INVALID_ADDRESS past the last region, MACH_SEND_INVALID_DEST when the process is gone.
    virtual kern_return_t mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size,
                                                 uint32_t& depth, vm_region_submap_info_64& info,
                                                 uint32_t& count) = 0;
    /// What is doubtful about the regions reported since the last call, a sentence each; most hosts have
    /// nothing to say.
    virtual std::vector<std::string> takeTaskWarnings(task_t) { return {}; }
    virtual kern_return_t mach_vm_region(task_t task, uint64_t& address, uint64_t& size,
                                         vm_region_basic_info_64& info, uint32_t& count) = 0;
    /// `control` is VM_PURGABLE_GET_STATE.
    virtual kern_return_t mach_vm_purgable_control(task_t task, uint64_t address, int32_t control,
                                                   int32_t& state) = 0;
    /// One word for each page of [start, start + length); `count` is the room in `dispositions` on entry and
    /// the number of words filled on return.
    virtual kern_return_t mach_vm_page_range_query(task_t task, uint64_t start, uint64_t length,
                                                   std::span<int32_t> dispositions, uint64_t& count) = 0;
    /// Bytes of the mapped file's path written to `path` (no NUL counted), 0 when there is none.
    virtual int proc_regionfilename(int32_t pid, uint64_t address, std::span<char> path) = 0;

    // Processes. Those that fill a record return the number of bytes filled, which is the record's size, or
    // a negative number with errno ESRCH when there is no such process.

    virtual int proc_pidinfo(int32_t pid, proc_bsdshortinfo& record) = 0;
    virtual int proc_pidinfo(int32_t pid, proc_bsdinfo& record) = 0;
    /// The number of pids, of which some may have no record; fills as many as `pids` has room for. An empty
    /// span asks for the number alone.
    virtual int proc_listallpids(std::span<int32_t> pids) = 0;
    /// 0 on success.
    virtual int proc_pid_rusage(int32_t pid, rusage_info_v5& record) = 0;
    virtual int proc_get_dirty(int32_t pid, uint32_t& flags) = 0;
    /// The largest argument area of any process, in bytes; 0 on success. (System control {1, 8}.)
    virtual int sysctlArgumentMaximum(uint64_t& bytes) = 0;
    /// A process's argument area (system control {1, 49, pid}): a 32-bit argument count, the path of the
    /// executable, then the arguments that the host tells, each NUL-terminated. `length` is the number of
    /// bytes written; 0 on success.
    virtual int sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) = 0;

    // Ledgers.

    /// Fills at most as many records as there is room for; returns 0 and the number filled, or negative.
    virtual int ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) = 0;
    virtual int ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) = 0;
    /// What the template says, read on first use and once, whichever thread comes first.
    const MWLedgerTable& ledgerTable();

    // Surveys.

    /// Some answers depend on who else is measured: an object that several processes hold is charged to one
    /// of them, and memory that nobody else of a measurement shares need not be looked up for its sharers. A
    /// measurement begins a survey and then names each task that it will ask about, before it asks about the
    /// first, and whether it will ask for the objects that the task owns. What asks without a survey gets
    /// answers that hold whoever is measured.
    virtual void beginSurvey() {}
    virtual void surveyTask(task_t, bool withOwnedVmObjects) { static_cast<void>(withOwnedVmObjects); }
    /// A process is measured that was saved on an earlier day, which can have shared anybody's memory.
    virtual void surveySavedProcess() {}

    // System controls by name.

    /// "vm.get_owned_vmobjects" for a task: the reply's bytes go to `reply` (none asks for the length
    /// alone), `length` is the room on entry and the bytes needed or written on return. ENOENT where the
    /// system has no such control.
    virtual int sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) = 0;
    /// "vm.self_region_memweight": the tool's own switch, 0 or 1.
    virtual int sysctlSelfRegionMemweight(int32_t& value) = 0;
    virtual int setSysctlSelfRegionMemweight(int32_t value) = 0;

    // The kernel's own memory.

    virtual kern_return_t mach_memory_info(MWKernelMemoryArrays& arrays) = 0;
    /// Gives an array of `size` bytes back that the host allocated for the caller.
    virtual kern_return_t vm_deallocate(const void* address, size_t size) = 0;
    virtual std::vector<MWKernelExtension> loadedKernelExtensions() = 0;
    /// To be used by one thread. Never none.
    virtual std::unique_ptr<KernelSymbolicator> makeKernelSymbolicator() = 0;

    virtual uint64_t vm_kernel_page_size() = 0;
    virtual std::string mach_error_string(kern_return_t code) = 0;
    /// Prints "LABEL: TEXT" on standard error.
    virtual void mach_error(std::string_view label, kern_return_t code) = 0;

    // Names and images.

    /// The system's own name for a tag that the program's table does not know, or none.
    virtual std::optional<std::string> describeRegionTypeForTag(uint32_t tag) = 0;
    /// The tag that the system gives to memory with a name of its own, the same throughout a run.
    virtual uint32_t tagForRegionType(const std::string& name) = 0;
    /// Calls back once for each image loaded in the task at the time of the call.
    virtual void forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) = 0;

    // Clocks.

    /// 0 on success.
    virtual int mach_get_times(MWClockReading& reading) = 0;
    virtual mach_timebase_info_t mach_timebase_info() = 0;
    /// The monotonic clock that stops while the system sleeps, in nanoseconds; timers go by it.
    virtual uint64_t uptimeNanoseconds() = 0;
    /// Gives `lock` up and takes it again when `changed` is notified, or after so much time of that clock.
    virtual void waitForChange(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                               uint64_t nanoseconds);
    /// A timer that is not armed; `handler` is given the number of fires and runs on `queue`, which outlives
    /// the timer. None with errno where the system has no more timers.
    virtual std::unique_ptr<MWTimer> makeTimer(MWSerialQueue& queue,
                                               std::function<void(uint64_t)> handler) = 0;

    // The tool's own surroundings.

    virtual int32_t getpid() = 0;
    virtual uint32_t geteuid() = 0;
    virtual bool isatty(int descriptor) = 0;
    /// Whether a file system object of this path exists (stat succeeds).
    virtual bool fileExists(const std::string& path) = 0;
    /// Removes `path` if it is a regular file; devices, pipes, links and directories are left alone. No link
    /// that somebody else planted is followed on the way (see MWOutputPlace).
    virtual void unlinkRegularFile(const std::string& path) = 0;

private:
    std::once_flag _ledgerTableRead;
    MWLedgerTable _ledgerTable;
};
