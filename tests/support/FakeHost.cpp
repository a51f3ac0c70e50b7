#include "support/FakeHost.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/MWPhysMemweightSwitch.h"

namespace {

// A task handle is the pid shifted, so that code which mixes the two up does not work by chance.
constexpr uint32_t kTaskShift = 4;

int32_t pidOfTask(task_t task) {
    return static_cast<int32_t>(task >> kTaskShift);
}

template <size_t N>
void copyText(std::array<char, N>& to, const std::string& from) {
    to.fill('\0');
    std::copy_n(from.begin(), std::min(from.size(), N), to.begin());
}

class FakeImageCursor : public MWImageDescription {
public:
    explicit FakeImageCursor(const FakeImage& image) : _image(image) {}
    std::string path() const override { return _image.path; }
    uint64_t baseAddress() const override { return _image.baseAddress; }
    void forEachSegment(const std::function<void(const MWImageSegmentDescription&)>& block) const override {
        for (const auto& segment : _image.segments) {
            block(segment);
        }
    }

private:
    const FakeImage& _image;
};

template <class Value>
std::optional<Value> valueAt(const std::map<uint64_t, Value>& values, uint64_t address) {
    const auto found = values.find(address);
    return found == values.end() ? std::nullopt : std::optional(found->second);
}

class FakeSymbolicator : public KernelSymbolicator {
public:
    explicit FakeSymbolicator(const FakeHost& host) : _host(host) {}
    std::optional<std::string> nameForAddress(uint64_t address) override {
        return valueAt(_host.kernelSymbols, address);
    }
    std::optional<SourceLocation> sourceLocationForAddress(uint64_t address) override {
        return valueAt(_host.kernelLocations, address);
    }

private:
    const FakeHost& _host;
};

}  // namespace

FakeHost::FakeHost() : _previous(MWHostInterface::setCurrent(this)) {
    MWPhysMemweightSwitch::set(false);
}

FakeHost::~FakeHost() {
    MWHostInterface::setCurrent(_previous);
}

int FakeHost::asked(const std::string& operation) const {
    const std::lock_guard lock(_mutex);
    const auto found = _asked.find(operation);
    return found == _asked.end() ? 0 : found->second;
}

void FakeHost::_count(const std::string& operation) {
    const std::lock_guard lock(_mutex);
    _asked[operation] += 1;
}

int FakeHost::_fail(int error) {
    errno = error;
    return -1;
}

const FakeProcess* FakeHost::_find(int32_t pid) {
    const auto found = processes.find(pid);
    if (found == processes.end() || found->second.gone) {
        errno = ESRCH;
        return nullptr;
    }
    return &found->second;
}

const FakeRegion* FakeHost::_regionAtOrAbove(task_t task, uint64_t address) {
    for (const auto& region : processes.at(pidOfTask(task)).regions) {
        // Also right for a region that claims to go on past the last address.
        if (region.start >= address || address - region.start < region.size) {
            return &region;
        }
    }
    return nullptr;
}

kern_return_t FakeHost::task_read_for_pid(int32_t pid, task_t& task) {
    _count("task_read_for_pid");
    const FakeProcess* process = _find(pid);
    if (process == nullptr || process->refused) {
        return KERN_FAILURE;
    }
    task = static_cast<task_t>(pid) << kTaskShift;
    const std::lock_guard lock(_mutex);
    openTasks.insert(task);
    return KERN_SUCCESS;
}

void FakeHost::task_release(task_t task) {
    const std::lock_guard lock(_mutex);
    openTasks.erase(task);
}

kern_return_t FakeHost::mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t&,
                                               vm_region_submap_info_64& info, uint32_t& count) {
    _count("mach_vm_region_recurse");
    const FakeProcess& process = processes.at(pidOfTask(task));
    {
        const std::lock_guard lock(_mutex);
        if (process.walkFailure != KERN_SUCCESS && _delivered[task] >= process.regionsBeforeFailure) {
            return process.walkFailure;
        }
        _delivered[task] += 1;
    }
    const FakeRegion* region = _regionAtOrAbove(task, address);
    if (region == nullptr) {
        return KERN_INVALID_ADDRESS;
    }
    address = region->start;
    size = region->size;
    info = region->info;
    count = region->words;
    return KERN_SUCCESS;
}

kern_return_t FakeHost::mach_vm_region(task_t task, uint64_t& address, uint64_t& size,
                                       vm_region_basic_info_64& info, uint32_t&) {
    _count("mach_vm_region");
    const FakeProcess& process = processes.at(pidOfTask(task));
    if (address >= process.mappingFailureFrom) {
        return KERN_FAILURE;
    }
    const FakeRegion* region = _regionAtOrAbove(task, address);
    if (region == nullptr) {
        return KERN_INVALID_ADDRESS;
    }
    address = region->start;
    size = region->size;
    info.offset = region->info.offset;
    info.user_wired_count = region->info.user_wired_count;
    return KERN_SUCCESS;
}

kern_return_t FakeHost::mach_vm_purgable_control(task_t task, uint64_t address, int32_t, int32_t& state) {
    const FakeRegion* region = _regionAtOrAbove(task, address);
    if (region == nullptr || region->purgeQueryFails) {
        return KERN_INVALID_ARGUMENT;
    }
    state = region->purgeState;
    return KERN_SUCCESS;
}

kern_return_t FakeHost::mach_vm_page_range_query(task_t task, uint64_t start, uint64_t length,
                                                 std::span<int32_t> dispositions, uint64_t& count) {
    const FakeProcess& process = processes.at(pidOfTask(task));
    if (process.pageQueryFailure != KERN_SUCCESS) {
        return process.pageQueryFailure;
    }
    count = std::min<uint64_t>(length / pageSize, dispositions.size());
    {
        const std::lock_guard lock(_mutex);
        pageQueries.emplace_back(start, count);
    }
    for (uint64_t page = 0; page < count; ++page) {
        const uint64_t address = start + page * pageSize;
        const FakeRegion* region = _regionAtOrAbove(task, address);
        dispositions[page] = 0;
        if (region != nullptr && address + pageSize > region->start) {
            const uint64_t index = address / pageSize - region->start / pageSize;
            dispositions[page] = index < region->pages.size() ? region->pages[index] : 0;
        }
    }
    return KERN_SUCCESS;
}

int FakeHost::proc_regionfilename(int32_t pid, uint64_t address, std::span<char> path) {
    const FakeRegion* region = _regionAtOrAbove(static_cast<task_t>(pid) << kTaskShift, address);
    if (region == nullptr || processes.at(pid).gone) {
        return 0;
    }
    const size_t length = std::min(region->path.size(), path.size());
    std::copy_n(region->path.begin(), length, path.begin());
    return static_cast<int>(length);
}

int FakeHost::proc_pidinfo(int32_t pid, proc_bsdshortinfo& record) {
    const FakeProcess* process = _find(pid);
    if (process == nullptr) {
        return -1;
    }
    record = {};
    record.pbsi_pid = static_cast<uint32_t>(pid);
    record.pbsi_status = process->status;
    return sizeof(record);
}

int FakeHost::proc_pidinfo(int32_t pid, proc_bsdinfo& record) {
    _count("proc_pidinfo.full");
    const FakeProcess* process = _find(pid);
    if (process == nullptr) {
        return -1;
    }
    record = {};
    record.pbi_flags = process->flags;
    record.pbi_status = process->status;
    record.pbi_pid = static_cast<uint32_t>(pid);
    record.pbi_ppid = static_cast<uint32_t>(process->parent);
    record.pbi_start_tvsec = process->startTime;
    copyText(record.pbi_comm, process->comm);
    copyText(record.pbi_name, process->name);
    return sizeof(record);
}

int FakeHost::proc_listallpids(std::span<int32_t> pids) {
    if (processListFails) {
        return -1;
    }
    auto free = pids.begin();
    for (auto process = processes.begin(); process != processes.end() && free != pids.end(); ++process) {
        *free++ = process->first;
    }
    return static_cast<int>(pids.empty() ? processes.size() : static_cast<size_t>(free - pids.begin()));
}

int FakeHost::proc_get_dirty(int32_t pid, uint32_t& flags) {
    const FakeProcess* process = _find(pid);
    if (process == nullptr) {
        return -1;
    }
    flags = process->dirtyFlags;
    return 0;
}

int FakeHost::sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) {
    const FakeProcess* process = _find(pid);
    if (process == nullptr || process->executable.empty()) {
        return _fail(EINVAL);
    }
    // The argument count, then the path.
    const std::string bytes = std::string("\1\0\0\0", 4) + process->executable + std::string(3, '\0');
    length = std::min(bytes.size(), area.size());
    std::copy_n(bytes.begin(), length, area.begin());
    return 0;
}

int FakeHost::sysctlSelfRegionMemweight(int32_t& value) {
    _count("sysctlSelfRegionMemweight");
    if (selfRegionMemweightError != 0) {
        return _fail(selfRegionMemweightError);
    }
    value = selfRegionMemweight;
    return 0;
}

int FakeHost::setSysctlSelfRegionMemweight(int32_t value) {
    if (selfRegionMemweightError != 0) {
        return _fail(selfRegionMemweightError);
    }
    selfRegionMemweight = value;
    return 0;
}

void FakeHost::mach_error(std::string_view label, kern_return_t code) {
    const std::lock_guard lock(_mutex);
    machErrors.push_back(std::string(label) + ": " + std::to_string(code));
}

std::optional<std::string> FakeHost::describeRegionTypeForTag(uint32_t tag) {
    const auto found = tagDescriptions.find(tag);
    return found == tagDescriptions.end() ? std::nullopt : std::optional(found->second);
}

void FakeHost::forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) {
    for (const auto& image : processes.at(pidOfTask(task)).images) {
        block(FakeImageCursor(image));
    }
}

int FakeHost::proc_pid_rusage(int32_t pid, rusage_info_v5& record) {
    const FakeProcess* process = _find(pid);
    if (process == nullptr || !process->usage) {
        return _fail(ESRCH);
    }
    record = *process->usage;
    return 0;
}

int FakeHost::ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) {
    _count("ledgerTemplate");
    if (ledgerTemplateError != 0) {
        return _fail(ledgerTemplateError);
    }
    filled = std::min(records.size(), ledgerNames.size());
    for (size_t index = 0; index < filled; ++index) {
        copyText(records[index].lti_name, ledgerNames[index]);
    }
    return 0;
}

int FakeHost::ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) {
    const FakeProcess& process = processes.at(pid);
    if (process.ledgerError != 0) {
        return _fail(process.ledgerError);
    }
    filled = std::min(records.size(), process.ledgerBalances.size());
    for (size_t index = 0; index < filled; ++index) {
        records[index].lei_balance = process.ledgerBalances[index];
    }
    return 0;
}

void FakeHost::surveyTask(task_t task, bool withOwnedVmObjects) {
    const std::lock_guard lock(_mutex);
    surveyed[task] = withOwnedVmObjects;
}

int FakeHost::sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) {
    const FakeProcess& process = processes.at(pidOfTask(task));
    const bool isFetch = !reply.empty();
    if (isFetch) {
        const std::lock_guard lock(_mutex);
        ownedFetches.push_back(reply.size());
    }
    if (const int error =
            isFetch && process.ownedFetchError != 0 ? process.ownedFetchError : process.ownedError) {
        return _fail(error);
    }
    const uint64_t count =
        isFetch ? process.owned.size() : process.ownedAtFirst.value_or(process.owned.size());
    std::vector<std::byte> bytes(count == 0 ? 0 : sizeof(count) + count * sizeof(OwnedObjectRecord));
    if (!bytes.empty()) {
        std::memcpy(bytes.data(), &count, sizeof(count));
        std::memcpy(bytes.data() + sizeof(count), process.owned.data(), bytes.size() - sizeof(count));
    }
    if (ownedReplyIsCut) {
        bytes.pop_back();
    }
    length = isFetch ? std::min(reply.size(), bytes.size()) : bytes.size();
    std::copy_n(bytes.begin(), isFetch ? length : 0, reply.begin());
    if (isFetch && ownedReplyIsEndless) {
        length = reply.size();
    }
    return 0;
}

kern_return_t FakeHost::mach_memory_info(MWKernelMemoryArrays& arrays) {
    _zoneNames.clear();
    _zones.clear();
    for (const auto& [name, zone] : kernelZones) {
        std::copy_n(name.begin(), std::min<size_t>(name.size(), 80),
                    _zoneNames.emplace_back().mzn_name.begin());
        _zones.push_back(zone);
    }
    if (kernelMemoryResult == KERN_SUCCESS) {
        arrays = {.zoneNames = _zoneNames, .zones = _zones, .records = kernelRecords};
    }
    return kernelMemoryResult;
}

kern_return_t FakeHost::vm_deallocate(const void*, size_t size) {
    deallocated.push_back(size);
    return deallocationResult;
}

std::unique_ptr<KernelSymbolicator> FakeHost::makeKernelSymbolicator() {
    return std::make_unique<FakeSymbolicator>(*this);
}

FakeTimer::FakeTimer(FakeHost& host, MWSerialQueue& queue, std::function<void(uint64_t)> handler)
    : _host(host), _queue(queue), _handler(std::move(handler)) {
    _host._timer = this;
}

// A timer does not go away under a thread that fires it.
FakeTimer::~FakeTimer() {
    const std::lock_guard lock(_host._timerMutex);
    _host._timer = nullptr;
}

void FakeTimer::arm(const MWTimerSchedule& schedule) {
    _host.schedules.push_back(schedule);
    if (_host.schedules.size() == 1) {
        _host.timerArmed.release();
    }
}

bool FakeTimer::fire(uint64_t fires) {
    if (!_isCancelled) {
        _queue.sync([&] { _handler(fires); });
    }
    return !_isCancelled;
}

bool FakeHost::fireTimer(uint64_t fires) {
    const std::lock_guard lock(_timerMutex);
    return _timer != nullptr && _timer->fire(fires);
}

std::unique_ptr<MWTimer> FakeHost::makeTimer(MWSerialQueue& queue, std::function<void(uint64_t)> handler) {
    if (noTimers) {
        errno = EMFILE;
        return nullptr;
    }
    return std::make_unique<FakeTimer>(*this, queue, std::move(handler));
}
