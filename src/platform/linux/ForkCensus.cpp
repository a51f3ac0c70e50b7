#include "platform/linux/ForkCensus.h"

#include <fcntl.h>

#include "platform/linux/LinuxTask.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace {

// Of a process whose first thread has ended, those of one that lives. Kernel threads have none.
std::string auxiliaryVectorOf(int processDirectory) {
    std::string text;
    if (procfs::readRecord(processDirectory, "auxv", text) && !text.empty()) {
        return text;
    }
    const auto stat =
        procfs::readRecord(processDirectory, "stat", text) ? procfs::parseStat(text) : std::nullopt;
    if (!stat || !stat->threadEnded()) {
        return {};
    }
    procfs::readRecord(openLiveThread(processDirectory).directory.get(), "auxv", text);
    return text;
}

}  // namespace

void ForkCensus::begin() {
    const std::lock_guard lock(_mutex);
    _programs.clear();
    _members.clear();
    _measured = 0;
    _complete = false;
}

void ForkCensus::addKernelThread(int32_t pid) {
    const std::lock_guard lock(_mutex);
    _kernelThreads.insert(pid);
}

void ForkCensus::forgetKernelThreads() {
    const std::lock_guard lock(_mutex);
    _kernelThreads.clear();
}

void ForkCensus::add(int32_t pid, uint64_t program) {
    const std::lock_guard lock(_mutex);
    ++_measured;
    _add(pid, program);
}

size_t ForkCensus::measured() const {
    const std::lock_guard lock(_mutex);
    return _measured;
}

void ForkCensus::_add(int32_t pid, uint64_t program) {
    if (_programs.emplace(pid, program).second) {
        ++_members[program];
    }
}

void ForkCensus::_addOthers() {
    procfs::forEachEntry(_proc, ".", [&](int directory, const char* name) {
        std::string_view number = name;
        int32_t pid = 0;
        if (procfs::takeNumber(number, pid) && number.empty() && !_programs.contains(pid) &&
            !_kernelThreads.contains(pid)) {
            const procfs::Descriptor process = procfs::open(directory, name, O_PATH | O_DIRECTORY);
            const std::string auxv = process ? auxiliaryVectorOf(process.get()) : "";
            _add(pid, auxv.empty() ? 0 : _identity.bytes(auxv));
        }
        return true;
    });
    _complete = true;
}

bool ForkCensus::isAlone(int32_t pid) {
    const std::lock_guard lock(_mutex);
    if (!_complete) {
        _addOthers();
    }
    const auto found = _programs.find(pid);
    return found != _programs.end() && found->second != 0 && _members.at(found->second) == 1;
}
