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
    _isLooking = false;
    ++_measurement;
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

/// Without the lock: the system may let this wait. False when another thread is at it.
bool ForkCensus::_lookAtOthers() {
    std::unordered_set<int32_t> known;
    uint64_t measurement = 0;
    {
        const std::lock_guard lock(_mutex);
        if (_complete || _isLooking) {
            return _complete;
        }
        _isLooking = true;
        measurement = _measurement;
        known = _kernelThreads;
        for (const auto& [pid, program] : _programs) {
            known.insert(pid);
        }
    }
    std::unordered_map<int32_t, uint64_t> others;
    procfs::forEachEntry(_proc, ".", [&](int directory, const char* name) {
        std::string_view number = name;
        int32_t pid = 0;
        if (procfs::takeNumber(number, pid) && number.empty() && !known.contains(pid)) {
            const procfs::Descriptor process = procfs::open(directory, name, O_PATH | O_DIRECTORY);
            const std::string auxv = process ? auxiliaryVectorOf(process.get()) : "";
            others.emplace(pid, auxv.empty() ? 0 : _identity.bytes(auxv));
        }
        return true;
    });
    const std::lock_guard lock(_mutex);
    if (measurement != _measurement) {
        return false;
    }
    for (const auto& [pid, program] : others) {
        _add(pid, program);
    }
    _isLooking = false;
    _complete = true;
    return true;
}

bool ForkCensus::isAlone(int32_t pid) {
    if (!_lookAtOthers()) {
        return false;
    }
    const std::lock_guard lock(_mutex);
    const auto found = _programs.find(pid);
    return found != _programs.end() && found->second != 0 && _members.at(found->second) == 1;
}
