#include <cstring>

#include "platform/linux/KernelMemory.h"
#include "platform/linux/MWLinuxHost.h"

// The questions about the kernel's own memory.

template <class Record>
std::span<const Record> MWLinuxHost::_handOver(const std::vector<Record>& records) {
    if (records.empty()) {
        return {};
    }
    const size_t size = std::span(records).size_bytes();
    auto bytes = std::make_unique<Record[]>(records.size());
    std::memcpy(bytes.get(), records.data(), size);
    const Record* array = bytes.get();
    const std::lock_guard lock(_kernelMutex);
    _kernelArrays[array] = {size, std::shared_ptr<void>(std::move(bytes))};
    return {array, records.size()};
}

kern_return_t MWLinuxHost::mach_memory_info(MWKernelMemoryArrays& arrays) {
    auto memory = readKernelMemory({.procDirectory = _run.proc.get(),
                                    .sysDirectory = _sys.get(),
                                    .pageSize = _run.pageSize,
                                    .pageTables = _run.pageTables});
    if (!memory) {
        return KERN_FAILURE;
    }
    arrays = {.zoneNames = _handOver(memory->zoneNames),
              .zones = _handOver(memory->zones),
              .records = _handOver(memory->records)};
    const std::lock_guard lock(_kernelMutex);
    _kernelSourceLocations = std::move(memory->locations);
    _kernelModules = std::move(memory->modules);
    return KERN_SUCCESS;
}

kern_return_t MWLinuxHost::vm_deallocate(const void* address, size_t size) {
    if (size == 0) {
        return KERN_SUCCESS;
    }
    const std::lock_guard lock(_kernelMutex);
    const auto found = _kernelArrays.find(address);
    if (found == _kernelArrays.end() || found->second.size != size) {
        return KERN_INVALID_ARGUMENT;
    }
    _kernelArrays.erase(found);
    return KERN_SUCCESS;
}

std::vector<MWKernelExtension> MWLinuxHost::loadedKernelExtensions() {
    const std::lock_guard lock(_kernelMutex);
    return _kernelModules;
}

std::unique_ptr<KernelSymbolicator> MWLinuxHost::makeKernelSymbolicator() {
    const std::lock_guard lock(_kernelMutex);
    return std::make_unique<LinuxKernelSymbolicator>(_run.proc.get(), _kernelSourceLocations);
}
