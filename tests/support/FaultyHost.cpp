#include "support/FaultyHost.h"

#include <algorithm>
#include <cerrno>
#include <chrono>

#include "platform/MWWorkQueue.h"

FaultyHost::FaultyHost(MWHostInterface& inner, std::optional<HostFault> fault)
    : _inner(inner), _previous(MWHostInterface::setCurrent(this)), _fault(std::move(fault)) {}

FaultyHost::~FaultyHost() {
    release();
    MWHostInterface::setCurrent(_previous);
}

int32_t FaultyHost::_pidOf(task_t task) {
    const std::lock_guard lock(_mutex);
    return _pids.at(task);
}

void FaultyHost::release() {
    _hangs = false;
    _hangs.notify_all();
    MWConcurrentQueue::awaitGivenUp();
}

void FaultyHost::_hang() {
    _hangs = true;
    _hangs.wait(true);
}

void FaultyHost::waitForChange(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                               uint64_t nanoseconds) {
    constexpr std::chrono::microseconds kTurnOfTheOthers(200);
    if (_hangs) {
        changed.wait_for(lock, kTurnOfTheOthers);
        _uptime += nanoseconds;
    } else {
        _inner.waitForChange(lock, changed, nanoseconds);
    }
}

std::optional<FaultKind> FaultyHost::_note(const std::string& operation, int32_t pid, Form form) {
    std::unique_lock lock(_mutex);
    const HostQuestion question = {operation, pid, ++_turns[{operation, pid}]};
    _questions.emplace(question, form);
    if (!_fault) {
        return std::nullopt;
    }
    if (question == _fault->question && _fault->kind == FaultKind::hangs) {
        lock.unlock();
        _hang();
        return std::nullopt;
    }
    if (question == _fault->question) {
        _isProcessGone = _fault->kind == FaultKind::processEnds;
        return _fault->kind;
    }
    return _isProcessGone && pid == _fault->question.pid ? std::optional(FaultKind::processEnds)
                                                         : std::nullopt;
}

template <class Amount>
Amount FaultyHost::_partOf(Amount whole, FaultKind kind) {
    return kind == FaultKind::isHalf ? whole / 2 : 0;
}

template <class Ask>
kern_return_t FaultyHost::_askKernel(const HostQuestion& question, const Ask& ask, kern_return_t codeWhenGone,
                                     uint64_t* amount) {
    const auto kind =
        _note(question.operation, question.pid, {.hasKernelCode = true, .hasAmount = amount != nullptr});
    if (kind == FaultKind::fails || kind == FaultKind::processEnds) {
        return kind == FaultKind::fails ? _fault->code : codeWhenGone;
    }
    const kern_return_t code = ask();
    if (kind && code == KERN_SUCCESS) {
        *amount = _partOf(*amount, *kind);
    }
    return code;
}

template <class Ask>
int FaultyHost::_ask(const HostQuestion& question, const Ask& ask, size_t* amount) {
    const auto kind =
        _note(question.operation, question.pid, {.hasErrno = true, .hasAmount = amount != nullptr});
    if (kind == FaultKind::fails || kind == FaultKind::processEnds) {
        errno = kind == FaultKind::fails ? _fault->code : ESRCH;
        return -1;
    }
    const int result = ask();
    if (kind && result == 0) {
        *amount = _partOf(*amount, *kind);
    }
    return result;
}

template <class Ask>
int FaultyHost::_askAmount(const HostQuestion& question, const Ask& ask) {
    int amount = -1;
    size_t filled = 0;
    const int result = _ask(
        question,
        [&] {
            amount = ask();
            filled = static_cast<size_t>(std::max(amount, 0));
            return std::min(amount, 0);
        },
        &filled);
    return result < 0 ? result : static_cast<int>(filled);
}

kern_return_t FaultyHost::task_read_for_pid(int32_t pid, task_t& task) {
    const auto ask = [&] { return _inner.task_read_for_pid(pid, task); };
    const kern_return_t code = _askKernel({"task_read_for_pid", pid}, ask, KERN_FAILURE);
    if (code == KERN_SUCCESS) {
        const std::lock_guard lock(_mutex);
        _pids[task] = pid;
    }
    return code;
}

kern_return_t FaultyHost::mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size,
                                                 uint32_t& depth, vm_region_submap_info_64& info,
                                                 uint32_t& count) {
    const auto ask = [&] { return _inner.mach_vm_region_recurse(task, address, size, depth, info, count); };
    return _askKernel({"mach_vm_region_recurse", _pidOf(task)}, ask, MACH_SEND_INVALID_DEST);
}

kern_return_t FaultyHost::mach_vm_region(task_t task, uint64_t& address, uint64_t& size,
                                         vm_region_basic_info_64& info, uint32_t& count) {
    const auto ask = [&] { return _inner.mach_vm_region(task, address, size, info, count); };
    return _askKernel({"mach_vm_region", _pidOf(task)}, ask, MACH_SEND_INVALID_DEST);
}

kern_return_t FaultyHost::mach_vm_purgable_control(task_t task, uint64_t address, int32_t control,
                                                   int32_t& state) {
    const auto ask = [&] { return _inner.mach_vm_purgable_control(task, address, control, state); };
    return _askKernel({"mach_vm_purgable_control", _pidOf(task)}, ask, KERN_INVALID_ARGUMENT);
}

kern_return_t FaultyHost::mach_vm_page_range_query(task_t task, uint64_t start, uint64_t length,
                                                   std::span<int32_t> dispositions, uint64_t& count) {
    const auto ask = [&] {
        return _inner.mach_vm_page_range_query(task, start, length, dispositions, count);
    };
    return _askKernel({"mach_vm_page_range_query", _pidOf(task)}, ask, KERN_INVALID_ARGUMENT, &count);
}

int FaultyHost::proc_regionfilename(int32_t pid, uint64_t address, std::span<char> path) {
    return _askAmount({"proc_regionfilename", pid},
                      [&] { return _inner.proc_regionfilename(pid, address, path); });
}

int FaultyHost::proc_pidinfo(int32_t pid, proc_bsdshortinfo& record) {
    return _askAmount({"proc_pidinfo (short)", pid}, [&] { return _inner.proc_pidinfo(pid, record); });
}

int FaultyHost::proc_pidinfo(int32_t pid, proc_bsdinfo& record) {
    return _askAmount({"proc_pidinfo", pid}, [&] { return _inner.proc_pidinfo(pid, record); });
}

int FaultyHost::proc_listallpids(std::span<int32_t> pids) {
    return _askAmount({"proc_listallpids"}, [&] { return _inner.proc_listallpids(pids); });
}

int FaultyHost::proc_pid_rusage(int32_t pid, rusage_info_v5& record) {
    return _ask({"proc_pid_rusage", pid}, [&] { return _inner.proc_pid_rusage(pid, record); });
}

int FaultyHost::proc_get_dirty(int32_t pid, uint32_t& flags) {
    return _ask({"proc_get_dirty", pid}, [&] { return _inner.proc_get_dirty(pid, flags); });
}

int FaultyHost::sysctlArgumentMaximum(uint64_t& bytes) {
    return _ask(
        {"sysctlArgumentMaximum"}, [&] { return _inner.sysctlArgumentMaximum(bytes); }, &bytes);
}

void FaultyHost::surveyTask(task_t task, bool withOwnedVmObjects) {
    _note("surveyTask", _pidOf(task), {});
    _inner.surveyTask(task, withOwnedVmObjects);
}

bool FaultyHost::hasSharedCache(task_t task) {
    _note("hasSharedCache", _pidOf(task), {});
    return _inner.hasSharedCache(task);
}

std::vector<std::string> FaultyHost::takeTaskWarnings(task_t task) {
    _note("takeTaskWarnings", _pidOf(task), {});
    return _inner.takeTaskWarnings(task);
}

int FaultyHost::sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) {
    const auto ask = [&] { return _inner.sysctlArgumentArea(pid, area, length); };
    return _ask({"sysctlArgumentArea", pid}, ask, &length);
}

int FaultyHost::ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) {
    return _ask(
        {"ledgerTemplate"}, [&] { return _inner.ledgerTemplate(records, filled); }, &filled);
}

int FaultyHost::ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) {
    const auto ask = [&] { return _inner.ledgerEntries(pid, records, filled); };
    return _ask({"ledgerEntries", pid}, ask, &filled);
}

int FaultyHost::sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) {
    const auto ask = [&] { return _inner.sysctlOwnedVmObjects(task, reply, length); };
    return _ask({"sysctlOwnedVmObjects", _pidOf(task)}, ask, &length);
}

int FaultyHost::sysctlSelfRegionMemweight(int32_t& value) {
    return _ask({"sysctlSelfRegionMemweight"}, [&] { return _inner.sysctlSelfRegionMemweight(value); });
}

int FaultyHost::setSysctlSelfRegionMemweight(int32_t value) {
    return _ask({"setSysctlSelfRegionMemweight"}, [&] { return _inner.setSysctlSelfRegionMemweight(value); });
}

kern_return_t FaultyHost::mach_memory_info(MWKernelMemoryArrays& arrays) {
    return _askKernel(
        {"mach_memory_info", 0}, [&] { return _inner.mach_memory_info(arrays); }, KERN_FAILURE);
}

kern_return_t FaultyHost::vm_deallocate(const void* address, size_t size) {
    return _askKernel(
        {"vm_deallocate", 0}, [&] { return _inner.vm_deallocate(address, size); }, KERN_FAILURE);
}

std::vector<MWKernelExtension> FaultyHost::loadedKernelExtensions() {
    const auto kind = _note("loadedKernelExtensions", 0, {.hasAmount = true});
    auto extensions = _inner.loadedKernelExtensions();
    extensions.resize(kind ? _partOf(extensions.size(), *kind) : extensions.size());
    return extensions;
}

void FaultyHost::forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) {
    const auto kind = _note("forEachImage", _pidOf(task), {.hasAmount = true});
    int listed = 0;
    _inner.forEachImage(task, [&](const MWImageDescription& image) {
        // Half of the images is every other one.
        if (!kind || (kind == FaultKind::isHalf && ++listed % 2 == 1)) {
            block(image);
        }
    });
}

int FaultyHost::mach_get_times(MWClockReading& reading) {
    return _ask({"mach_get_times"}, [&] { return _inner.mach_get_times(reading); });
}
