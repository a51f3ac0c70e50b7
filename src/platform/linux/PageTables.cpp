#include "platform/linux/PageTables.h"

void PageTables::set(int32_t pid, uint64_t bytes) {
    const std::lock_guard lock(_mutex);
    _bytes[pid] = bytes;
}

void PageTables::forget(int32_t pid) {
    const std::lock_guard lock(_mutex);
    _bytes.erase(pid);
}

std::optional<uint64_t> PageTables::of(int32_t pid) const {
    const std::lock_guard lock(_mutex);
    const auto found = _bytes.find(pid);
    return found == _bytes.end() ? std::nullopt : std::optional(found->second);
}
