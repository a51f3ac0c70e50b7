#include "platform/linux/MWLinuxHost.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <iterator>
#include <optional>
#include <utility>

#include "platform/MWOutputPlace.h"
#include "platform/linux/LinuxTask.h"
#include "platform/linux/LinuxTimer.h"

namespace {

// With all the processes of a machine as targets each holds a directory open for the length of a run.
void raiseDescriptorLimit() {
    rlimit limit = {};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
}

class LinuxImageDescription : public MWImageDescription {
public:
    explicit LinuxImageDescription(const LinuxImage& image) : _image(image) {}
    // The kernel reports the file that is mapped, whichever links led to it.
    std::string path() const override { return _image.path; }
    uint64_t baseAddress() const override { return _image.baseAddress(); }
    void forEachSegment(const std::function<void(const MWImageSegmentDescription&)>& block) const override {
        for (const LinuxImage::Segment& segment : _image.segments) {
            block({.name = segment.name, .start = segment.start, .length = segment.size});
        }
    }

private:
    const LinuxImage& _image;
};

// Of the tasks of all hosts there ever are.
uint64_t newGeneration() {
    static std::atomic<uint64_t> last = 0;
    return ++last;
}

uint64_t readClock(clockid_t clock) {
    constexpr uint64_t kNanosecondsPerSecond = 1'000'000'000;
    timespec time = {};
    clock_gettime(clock, &time);
    return static_cast<uint64_t>(time.tv_sec) * kNanosecondsPerSecond + static_cast<uint64_t>(time.tv_nsec);
}

}  // namespace

MWLinuxHost::MWLinuxHost(const std::string& procDirectory, const std::string& sysDirectory,
                         MappingSource mappingSource)
    : _tasksGeneration(newGeneration()),
      _run(procDirectory, mappingSource),
      _sys(procfs::open(AT_FDCWD, sysDirectory.c_str(), O_DIRECTORY)) {
    raiseDescriptorLimit();
}

MWLinuxHost::~MWLinuxHost() = default;

// A walk asks about one task thousands of times in a row, on a thread of its own.
LinuxTask* MWLinuxHost::_task(task_t task) {
    struct Answer {
        uint64_t generation = 0;
        task_t task = 0;
        LinuxTask* record = nullptr;
    };
    thread_local Answer last;
    const uint64_t generation = _tasksGeneration;
    if (last.record == nullptr || last.task != task || last.generation != generation) {
        const std::lock_guard lock(_tasksMutex);
        const auto found = _tasks.find(task);
        last = {.generation = generation,
                .task = task,
                .record = found == _tasks.end() ? nullptr : found->second.get()};
    }
    return last.record;
}

void MWLinuxHost::_forgetListed() {
    const std::lock_guard lock(_listedMutex);
    _listed.clear();
    _listedPids.clear();
}

std::optional<ListedProcess> MWLinuxHost::_takeListed(int32_t pid) {
    const std::lock_guard lock(_listedMutex);
    auto found = _listed.extract(pid);
    return found.empty() ? std::nullopt : std::optional(std::move(found.mapped()));
}

kern_return_t MWLinuxHost::task_read_for_pid(int32_t pid, task_t& task) {
    auto listed = _takeListed(pid);
    std::unique_ptr<LinuxTask> opened =
        listed ? LinuxTask::open(_run, pid, *std::move(listed)) : LinuxTask::open(_run, pid);
    if (opened == nullptr) {
        return errno == EMFILE || errno == ENFILE ? KERN_RESOURCE_SHORTAGE : KERN_FAILURE;
    }
    const std::lock_guard lock(_tasksMutex);
    do {
        ++_lastTask;
    } while (_lastTask == 0 || _tasks.contains(_lastTask));
    task = _lastTask;
    _tasks.emplace(task, std::move(opened));
    _tasksByPid.emplace(pid, task);
    _tasksGeneration = newGeneration();
    return KERN_SUCCESS;
}

void MWLinuxHost::task_release(task_t task) {
    const std::lock_guard lock(_tasksMutex);
    const auto found = _tasks.find(task);
    if (found != _tasks.end()) {
        _tasksByPid.erase({found->second->pid(), task});
        _tasks.erase(found);
        _tasksGeneration = newGeneration();
    }
}

bool MWLinuxHost::hasSharedCache(task_t) {
    return false;
}

const AddressSpaceRegion* MWLinuxHost::_regionAtOrAbove(task_t task, uint64_t address, kern_return_t& code) {
    LinuxTask* record = _task(task);
    if (record == nullptr) {
        code = KERN_INVALID_ARGUMENT;
        return nullptr;
    }
    code = record->takeSnapshot();
    if (code != KERN_SUCCESS) {
        return nullptr;
    }
    const AddressSpaceRegion* region = record->addressSpace().regionAtOrAbove(address);
    if (region == nullptr) {
        record->dropSnapshot();
        code = KERN_INVALID_ADDRESS;
    }
    return region;
}

kern_return_t MWLinuxHost::mach_vm_region_recurse(task_t task, uint64_t& address, uint64_t& size, uint32_t&,
                                                  vm_region_submap_info_64& info, uint32_t& count) {
    kern_return_t code = KERN_SUCCESS;
    if (const AddressSpaceRegion* region = _regionAtOrAbove(task, address, code)) {
        address = region->start;
        size = region->size;
        info = region->info;
        count = VM_REGION_SUBMAP_INFO_COUNT_64;
    }
    return code;
}

kern_return_t MWLinuxHost::mach_vm_region(task_t task, uint64_t& address, uint64_t& size,
                                          vm_region_basic_info_64& info, uint32_t& count) {
    kern_return_t code = KERN_SUCCESS;
    if (const AddressSpaceRegion* region = _regionAtOrAbove(task, address, code)) {
        address = region->start;
        size = region->size;
        info = {};
        info.protection = region->info.protection;
        info.max_protection = region->info.max_protection;
        info.shared = region->info.share_mode == SM_SHARED ? 1 : 0;
        info.offset = region->info.offset;
        info.user_wired_count = region->info.user_wired_count;
        count = VM_REGION_BASIC_INFO_COUNT_64;
    }
    return code;
}

std::vector<std::string> MWLinuxHost::takeTaskWarnings(task_t task) {
    LinuxTask* record = _task(task);
    return record == nullptr ? std::vector<std::string>{} : record->takeWarnings();
}

kern_return_t MWLinuxHost::mach_vm_purgable_control(task_t, uint64_t, int32_t, int32_t& state) {
    state = VM_PURGABLE_DENY;
    return KERN_SUCCESS;
}

kern_return_t MWLinuxHost::mach_vm_page_range_query(task_t task, uint64_t start, uint64_t length,
                                                    std::span<int32_t> dispositions, uint64_t& count) {
    LinuxTask* record = _task(task);
    if (record == nullptr) {
        return KERN_INVALID_ARGUMENT;
    }
    const kern_return_t code = record->takeSnapshot();
    if (code != KERN_SUCCESS) {
        return code == MACH_SEND_INVALID_DEST ? KERN_INVALID_ARGUMENT : code;
    }
    count = std::min<uint64_t>(length / _run.pageSize, dispositions.size());
    return record->fillDispositions(start, dispositions.first(count));
}

// Two records of one pid live at once only while sampling replaces one by the other; the newer one is being
// walked then.
LinuxTask* MWLinuxHost::_taskOfPid(int32_t pid) {
    struct Answer {
        uint64_t generation = 0;
        int32_t pid = 0;
        LinuxTask* record = nullptr;
    };
    thread_local Answer last;
    const uint64_t generation = _tasksGeneration;
    if (last.record == nullptr || last.pid != pid || last.generation != generation) {
        const std::lock_guard lock(_tasksMutex);
        last = {.generation = generation, .pid = pid, .record = _newestTaskOfPid(pid)};
    }
    return last.record;
}

LinuxTask* MWLinuxHost::_newestTaskOfPid(int32_t pid) const {
    const auto above = _tasksByPid.upper_bound({pid, UINT32_MAX});
    if (above == _tasksByPid.begin() || std::prev(above)->first != pid) {
        return nullptr;
    }
    return _tasks.at(std::prev(above)->second).get();
}

int MWLinuxHost::proc_regionfilename(int32_t pid, uint64_t address, std::span<char> path) {
    LinuxTask* record = _taskOfPid(pid);
    if (record == nullptr || !record->hasSnapshot()) {
        return 0;
    }
    const AddressSpaceRegion* region = record->addressSpace().regionAtOrAbove(address);
    if (region == nullptr || region->start > address) {
        return 0;
    }
    const size_t length = std::min(path.size(), region->path.size());
    std::copy_n(region->path.begin(), length, path.begin());
    return static_cast<int>(length);
}

std::optional<std::string> MWLinuxHost::describeRegionTypeForTag(uint32_t tag) {
    return _run.names.nameForTag(tag);
}

// A process that cannot be looked at has no images; the walk meets the same failure and reports it.
void MWLinuxHost::forEachImage(task_t task, const std::function<void(const MWImageDescription&)>& block) {
    LinuxTask* record = _task(task);
    if (record == nullptr || record->takeSnapshot() != KERN_SUCCESS) {
        return;
    }
    for (const LinuxImage& image : record->addressSpace().images()) {
        block(LinuxImageDescription(image));
    }
}

void MWLinuxHost::beginSurvey() {
    _forgetListed();
    _run.begin();
}

void MWLinuxHost::surveyTask(task_t task, bool withOwnedVmObjects) {
    if (LinuxTask* record = _task(task)) {
        record->survey(withOwnedVmObjects);
    }
}

void MWLinuxHost::surveySavedProcess() {
    _run.forkCensus.addSaved();
}

// An 8-byte count, then the records.
int MWLinuxHost::sysctlOwnedVmObjects(task_t task, std::span<std::byte> reply, size_t& length) {
    LinuxTask* record = _task(task);
    if (record == nullptr) {
        errno = ESRCH;
        return -1;
    }
    const std::vector<OwnedObjectRecord> objects = record->ownedObjects();
    const uint64_t count = objects.size();
    std::vector<std::byte> bytes(objects.empty() ? 0 : sizeof(count) + count * sizeof(OwnedObjectRecord));
    if (!bytes.empty()) {
        std::memcpy(bytes.data(), &count, sizeof(count));
        std::memcpy(bytes.data() + sizeof(count), objects.data(), count * sizeof(OwnedObjectRecord));
    }
    length = reply.empty() ? bytes.size() : std::min(reply.size(), bytes.size());
    std::copy_n(bytes.begin(), std::min(reply.size(), bytes.size()), reply.begin());
    return 0;
}

int MWLinuxHost::sysctlSelfRegionMemweight(int32_t& value) {
    value = _selfRegionMemweight;
    return 0;
}

int MWLinuxHost::setSysctlSelfRegionMemweight(int32_t value) {
    _selfRegionMemweight = value;
    return 0;
}

std::string MWLinuxHost::mach_error_string(kern_return_t code) {
    switch (code) {
        case KERN_SUCCESS:
            return "(os/kern) successful";
        case KERN_INVALID_ADDRESS:
            return "(os/kern) invalid address";
        case KERN_INVALID_ARGUMENT:
            return "(os/kern) invalid argument";
        case KERN_FAILURE:
            return "(os/kern) failure";
        case KERN_RESOURCE_SHORTAGE:
            return "too many open files";
        case MACH_SEND_INVALID_DEST:
            return "the address space is gone";
        default:
            return "error " + std::to_string(code);
    }
}

void MWLinuxHost::mach_error(std::string_view label, kern_return_t code) {
    std::fprintf(stderr, "%.*s: %s\n", static_cast<int>(label.size()), label.data(),
                 mach_error_string(code).c_str());
}

int MWLinuxHost::mach_get_times(MWClockReading& reading) {
    timespec wall = {};
    if (clock_gettime(CLOCK_REALTIME, &wall) != 0) {
        return -1;
    }
    reading = {.absoluteTicks = readClock(CLOCK_MONOTONIC),
               .continuousTicks = readClock(CLOCK_BOOTTIME),
               .wallSeconds = wall.tv_sec,
               .wallNanoseconds = wall.tv_nsec};
    return 0;
}

mach_timebase_info_t MWLinuxHost::mach_timebase_info() {
    return {.numer = 1, .denom = 1};
}

uint64_t MWLinuxHost::uptimeNanoseconds() {
    return readClock(CLOCK_MONOTONIC);
}

std::unique_ptr<MWTimer> MWLinuxHost::makeTimer(MWSerialQueue& queue, std::function<void(uint64_t)> handler) {
    return LinuxTimer::create(queue, std::move(handler));
}

int32_t MWLinuxHost::getpid() {
    return ::getpid();
}

uint32_t MWLinuxHost::geteuid() {
    return ::geteuid();
}

bool MWLinuxHost::isatty(int descriptor) {
    return ::isatty(descriptor) != 0;
}

bool MWLinuxHost::fileExists(const std::string& path) {
    struct stat status = {};
    return ::stat(path.c_str(), &status) == 0;
}

void MWLinuxHost::unlinkRegularFile(const std::string& path) {
    if (const auto place = MWOutputPlace::findWithoutLast(path)) {
        place->unlinkRegularFile();
    }
}
