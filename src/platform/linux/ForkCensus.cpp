#include "platform/linux/ForkCensus.h"

void ForkCensus::begin() {
    const std::lock_guard lock(_mutex);
    _programs.clear();
    _members.clear();
    _hasSaved = false;
}

void ForkCensus::add(int32_t pid, uint64_t program) {
    const std::lock_guard lock(_mutex);
    if (_programs.emplace(pid, program).second) {
        ++_members[program];
    }
}

void ForkCensus::addSaved() {
    const std::lock_guard lock(_mutex);
    _hasSaved = true;
}

size_t ForkCensus::measured() const {
    const std::lock_guard lock(_mutex);
    return _programs.size();
}

bool ForkCensus::isAlone(int32_t pid) const {
    const std::lock_guard lock(_mutex);
    const auto found = _programs.find(pid);
    return !_hasSaved && found != _programs.end() && found->second != 0 && _members.at(found->second) == 1;
}
