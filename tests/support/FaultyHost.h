#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "platform/MWHostInterface.h"

/// One question to a host: the N-th (from 1) of this operation about this process. Whichever threads ask, a
/// run has the same questions as the run before.
struct HostQuestion {
    std::string operation;
    int32_t pid = -1;  ///< -1: about no process
    int turn = 1;

    auto operator<=>(const HostQuestion&) const = default;
};

/// What can become of an answer.
enum class FaultKind : uint8_t {
    fails,   ///< with the fault's code
    isHalf,  ///< of the bytes, records or words
    isEmpty,
    processEnds,  ///< before it: this question and all later ones find the process gone
    hangs,        ///< until the host is released
};

struct HostFault {
    HostQuestion question;
    FaultKind kind = FaultKind::fails;
    int code = 0;  ///< a kern_return_t or an errno, as the operation has it
};

/// Asks another host, notes the questions, and spoils the answer to one of them. Installs itself as the
/// current host for its lifetime.
class FaultyHost : public MWHostInterface {
public:
    /// What a question can be answered with beside the truth.
    struct Form {
        bool hasKernelCode = false;
        bool hasErrno = false;
        bool hasAmount = false;
    };

    explicit FaultyHost(MWHostInterface& inner, std::optional<HostFault> fault = {});
    ~FaultyHost() override;
    FaultyHost(const FaultyHost&) = delete;
    FaultyHost& operator=(const FaultyHost&) = delete;

    const std::map<HostQuestion, Form>& questions() const { return _questions; }
    /// Answers the question that hangs, if one does, and waits for what was given up for it.
    void release();

    kern_return_t task_read_for_pid(int32_t pid, task_t& task) override;
    void task_release(task_t task) override { _inner.task_release(task); }
    bool hasSharedCache(task_t task) override;
    kern_return_t mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t& depth,
                                         vm_region_submap_info_64& info, uint32_t& count) override;
    std::vector<std::string> takeTaskWarnings(task_t task) override;
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
    int sysctlArgumentMaximum(uint64_t& bytes) override;
    int sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) override;
    int ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) override;
    int ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) override;
    void beginSurvey() override { _inner.beginSurvey(); }
    void surveySavedProcess() override { _inner.surveySavedProcess(); }
    void surveyTask(task_t task, bool withOwnedVmObjects) override;
    int sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) override;
    int sysctlSelfRegionMemweight(int32_t& value) override;
    int setSysctlSelfRegionMemweight(int32_t value) override;
    kern_return_t mach_memory_info(MWKernelMemoryArrays& arrays) override;
    kern_return_t vm_deallocate(const void* address, size_t size) override;
    std::vector<MWKernelExtension> loadedKernelExtensions() override;
    std::unique_ptr<KernelSymbolicator> makeKernelSymbolicator() override {
        return _inner.makeKernelSymbolicator();
    }
    uint64_t vm_kernel_page_size() override { return _inner.vm_kernel_page_size(); }
    std::string mach_error_string(kern_return_t code) override { return _inner.mach_error_string(code); }
    void mach_error(std::string_view label, kern_return_t code) override { _inner.mach_error(label, code); }
    std::optional<std::string> describeRegionTypeForTag(uint32_t tag) override {
        return _inner.describeRegionTypeForTag(tag);
    }
    uint32_t tagForRegionType(const std::string& name) override { return _inner.tagForRegionType(name); }
    void forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) override;
    int mach_get_times(MWClockReading& reading) override;
    mach_timebase_info_t mach_timebase_info() override { return _inner.mach_timebase_info(); }
    /// A clock of its own: it runs, at a great pace, while a question hangs.
    uint64_t uptimeNanoseconds() override { return _uptime; }
    void waitForChange(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                       uint64_t nanoseconds) override;
    std::unique_ptr<MWTimer> makeTimer(MWSerialQueue& queue, std::function<void(uint64_t)> handler) override {
        return _inner.makeTimer(queue, std::move(handler));
    }
    int32_t getpid() override { return _inner.getpid(); }
    uint32_t geteuid() override { return _inner.geteuid(); }
    bool isatty(int descriptor) override { return _inner.isatty(descriptor); }
    bool fileExists(const std::string& path) override { return _inner.fileExists(path); }
    void unlinkRegularFile(const std::string& path) override { _inner.unlinkRegularFile(path); }

private:
    int32_t _pidOf(task_t task);
    void _hang();
    /// Notes the question; the kind of fault that its answer has, if it has one.
    std::optional<FaultKind> _note(const std::string& operation, int32_t pid, Form form);
    template <class Amount>
    static Amount _partOf(Amount whole, FaultKind kind);
    /// The answer to a question; `amount` is how much the inner host has filled, where it fills something.
    template <class Ask>
    kern_return_t _askKernel(const HostQuestion& question, const Ask& ask, kern_return_t codeWhenGone,
                             uint64_t* amount = nullptr);
    template <class Ask>
    int _ask(const HostQuestion& question, const Ask& ask, size_t* amount = nullptr);
    /// Of an operation whose answer is how much it has filled.
    template <class Ask>
    int _askAmount(const HostQuestion& question, const Ask& ask);

    MWHostInterface& _inner;
    MWHostInterface* _previous;
    const std::optional<HostFault> _fault;
    std::mutex _mutex;  ///< guards what follows
    std::map<HostQuestion, Form> _questions;
    std::map<std::pair<std::string, int32_t>, int> _turns;
    std::map<task_t, int32_t> _pids;
    bool _isProcessGone = false;  ///< that of the fault
    std::atomic<bool> _hangs = false;
    std::atomic<uint64_t> _uptime = 0;
};
