#include "process/MWUserProcess.h"

#include <fmt/core.h>
#include <fmt/printf.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <system_error>

#include "platform/MWHostInterface.h"
#include "platform/MWTerminalText.h"

namespace {

constexpr uint32_t kImageAlignmentInSharedCache = 4096;
constexpr size_t kLongestErrorText = 255;

/// What became of a process whose kernel objects have gone away, as the end of a message; empty while it
/// lives.
std::string_view fateOfProcess(int32_t pid) {
    proc_bsdshortinfo info = {};
    if (MWHostInterface::current().proc_pidinfo(pid, info) < 0) {
        return errno == ESRCH ? " (process exited)" : "";
    }
    return info.pbsi_status == SZOMB ? " (zombie)" : "";
}

}  // namespace

std::shared_ptr<MWUserProcess> MWUserProcess::initWithBsdInfo(const proc_bsdinfo& info) {
    std::shared_ptr<MWUserProcess> process(new MWUserProcess);
    return process->_initWithBsdInfo(info) ? process : nullptr;
}

MWUserProcess::~MWUserProcess() {
    if (_task) {
        MWHostInterface::current().task_release(*_task);
    }
}

bool MWUserProcess::_initWithBsdInfo(const proc_bsdinfo& info) {
    setPid(static_cast<int32_t>(info.pbi_pid));
    _startTime = {info.pbi_start_tvsec, info.pbi_start_tvusec};
    _gatherIsTranslated();
    if (!MWProcess::_initWithBsdInfo(info)) {
        return false;
    }
    // Only an unknown platform fails, and a process without a shared cache is measured all the same.
    _setSharedRegionFromPlatform(_platformCode());
    _images = std::make_shared<MWImageList>();
    _gatherPhysMemweight();
    _gatherLedgers();
    _gatherIdleExitStatus();
    _sharedRegionAlignmentSize = kImageAlignmentInSharedCache;
    return true;
}

bool MWUserProcess::_hasSharedCache() const {
    return MWHostInterface::current().hasSharedCache(*_task);
}

int MWUserProcess::_platformCode() const {
    if (!_hasSharedCache()) {
        return MWPlatformNoSharedCache;
    }
    if (isTranslated()) {
        return MWPlatformX86_64;
    }
    return is64bit() ? MWPlatformArm64 : MWPlatformArm;
}

bool MWUserProcess::_populateTask() {
    MWHostInterface& host = MWHostInterface::current();
    task_t task = 0;
    const kern_return_t result = host.task_read_for_pid(pid(), task);
    if (result != KERN_SUCCESS) {
        host.mach_error("task_read_for_pid", result);
        return false;
    }
    _task = task;
    return true;
}

void MWUserProcess::_gatherIdleExitStatus() {
    if (!_isAlive()) {
        return;
    }
    // A refused question leaves the flags clear: not tracked.
    uint32_t flags = 0;
    MWHostInterface::current().proc_get_dirty(pid(), flags);
    _setIdleExitStatusFromDirtyFlags(flags);
}

void MWUserProcess::_setIdleExitStatusFromDirtyFlags(uint32_t flags) {
    constexpr uint32_t eligible = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    if ((flags & eligible) != eligible) {
        _setIdleExitStatus(IdleExitIneligible);
    } else {
        _setIdleExitStatus((flags & PROC_DIRTY_IS_DIRTY) != 0 ? IdleExitDirty : IdleExitClean);
    }
}

void MWUserProcess::gatherData() {
    if (memoryRegions()) {
        return;
    }
    if (!_configurePageSize()) {
        fmt::fprintf(stderr, "skipping process %s due to an error configuring page size for analysis\n",
                     MWErrorText(displayString()));
        return;
    }
    if (!hiddenFromDisplay()) {
        _gatherImageData();
        _gatherPhysMemweight();
        _ownedVmObjects = _gatherOwnedVmObjects();
    }
    _gatherMemoryData();
    _images.reset();
    _canBeAnalyzedAgain = std::ranges::none_of(
        *memoryRegions(), [](const auto& region) { return region->subrangeList() != nullptr; });
}

void MWUserProcess::_processMachVMError(kern_return_t result, MWExpectedError expected) {
    std::string_view fate;
    if (result == expected.expectingErrorOnExit && _isAlive()) {
        fate = fateOfProcess(pid());
    }
    std::string message =
        fmt::format("{}: {}{}", displayString(), MWHostInterface::current().mach_error_string(result), fate);
    if (fate.empty()) {
        _addError(std::move(message));
    } else {
        _addWarning(std::move(message));
    }
}

void MWUserProcess::_addTaskWarnings() {
    if (!_task) {
        return;
    }
    for (const std::string& warning : MWHostInterface::current().takeTaskWarnings(*_task)) {
        _addWarning(fmt::format("{}: {}", displayString(), warning));
    }
}

void MWUserProcess::_addErrnoWarningWithDescription(std::string_view description) {
    const std::string text = std::generic_category().message(errno).substr(0, kLongestErrorText);
    std::string message = fmt::format("{}: {} - {}", displayString(), description, text);
    fmt::fprintf(stderr, "%s\n", MWErrorText(message));
    _addWarning(std::move(message));
}

void MWUserProcess::_printBailingOut() const {
    fmt::fprintf(stderr, "bailing out for process %s; data may be incomplete!\n",
                 MWErrorText(displayString()));
}
