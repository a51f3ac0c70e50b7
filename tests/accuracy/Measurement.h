#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "platform/linux/MWLinuxHost.h"

/// What one run of the program reports, as far as the accuracy tests look at it. Sizes are bytes, dirty and
/// swapped together.
struct Measurement {
    uint64_t summary = 0;
    std::map<pid_t, uint64_t> charges;
    /// Of each process: the sums of its tables, by the processes that share the memory (itself included).
    std::map<pid_t, std::map<std::set<pid_t>, uint64_t>> tables;
    struct Region {
        uint64_t start;
        std::string text;  ///< everything else that is reported of it
    };
    std::map<pid_t, std::vector<Region>> regions;
    std::set<pid_t> readFromSmaps;
    std::vector<std::string> errors;
    std::chrono::nanoseconds duration = {};
};

/// Measures these processes, in the mode that breaks the physical charge down, on a live host of its own.
Measurement measure(const std::vector<pid_t>& pids, MappingSource source = MappingSource::cheapest);
/// Measures everything but the kernel.
Measurement measureAll();
/// As another user without capabilities measures them: summary, charges, how many errors.
Measurement measureAsUser(uid_t user, const std::vector<pid_t>& pids);
