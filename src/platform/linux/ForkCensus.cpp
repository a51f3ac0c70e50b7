#include "platform/linux/ForkCensus.h"

void ForkCensus::begin() {
    const std::lock_guard lock(_mutex);
    _execs.clear();
    _members.clear();
    _anybodyCanBeMeasured = false;
}

void ForkCensus::add(int32_t pid, uint64_t exec) {
    const std::lock_guard lock(_mutex);
    if (_execs.emplace(pid, exec).second) {
        ++_members[exec];
    }
    _anybodyCanBeMeasured |= exec == 0;
}

void ForkCensus::addSaved() {
    const std::lock_guard lock(_mutex);
    _anybodyCanBeMeasured = true;
}

size_t ForkCensus::measured() const {
    const std::lock_guard lock(_mutex);
    return _execs.size();
}

bool ForkCensus::isAlone(int32_t pid) const {
    const std::lock_guard lock(_mutex);
    const auto found = _execs.find(pid);
    return !_anybodyCanBeMeasured && found != _execs.end() && _members.at(found->second) == 1;
}
