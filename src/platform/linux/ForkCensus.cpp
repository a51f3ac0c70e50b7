#include "platform/linux/ForkCensus.h"

#include <fcntl.h>

#include "platform/linux/ForkFamily.h"
#include "platform/linux/LinuxTask.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace {

// Of a process whose first thread has ended, those of one that lives. Kernel threads have none.
std::optional<uint64_t> identifierOf(int processDirectory, int32_t pid, const ObjectIdentity& identity) {
    std::string text;
    if (procfs::readRecord(processDirectory, "auxv", text) && !text.empty()) {
        return randomBytesIdentifier(text, pid, identity);
    }
    const auto stat =
        procfs::readRecord(processDirectory, "stat", text) ? procfs::parseStat(text) : std::nullopt;
    if (!stat || !stat->threadEnded()) {
        return std::nullopt;
    }
    const LiveThread thread = openLiveThread(processDirectory);
    procfs::readRecord(thread.directory.get(), "auxv", text);
    return randomBytesIdentifier(text, thread.identifier, identity);
}

}  // namespace

void ForkCensus::begin() {
    const std::lock_guard lock(_mutex);
    _identifiers.clear();
    _members.clear();
    _measured = 0;
    _complete = false;
}

void ForkCensus::add(int32_t pid, std::optional<uint64_t> identifier) {
    const std::lock_guard lock(_mutex);
    ++_measured;
    _add(pid, identifier);
}

size_t ForkCensus::measured() const {
    const std::lock_guard lock(_mutex);
    return _measured;
}

void ForkCensus::_add(int32_t pid, std::optional<uint64_t> identifier) {
    if (_identifiers.emplace(pid, identifier).second && identifier) {
        ++_members[*identifier];
    }
}

void ForkCensus::_addOthers() {
    procfs::forEachEntry(_proc, ".", [&](int directory, const char* name) {
        std::string_view number = name;
        int32_t pid = 0;
        if (procfs::takeNumber(number, pid) && number.empty() && !_identifiers.contains(pid)) {
            const procfs::Descriptor process = procfs::open(directory, name, O_PATH | O_DIRECTORY);
            _add(pid, process ? identifierOf(process.get(), pid, _identity) : std::nullopt);
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
    const auto found = _identifiers.find(pid);
    return found != _identifiers.end() && found->second && _members.at(*found->second) == 1;
}
