#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <unordered_map>

/// The page tables of the processes that tasks stand for, in bytes, as last read. Safe for use from several
/// threads.
class PageTables {
public:
    void set(int32_t pid, uint64_t bytes);
    void forget(int32_t pid);
    std::optional<uint64_t> of(int32_t pid) const;

private:
    mutable std::mutex _mutex;
    std::unordered_map<int32_t, uint64_t> _bytes;
};
