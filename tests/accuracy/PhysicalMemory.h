#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

/// What the kernel says of memory, in bytes; the truth that measurements are compared with. Read without any
/// code of the program.

/// Every page frame and every swap entry that any of the processes maps, once: anonymous memory that was not
/// lazily freed, shmem, huge pages and dirty file pages; and the page tables of each address space. Without
/// the zero page, clean file pages and the swapped part of shmem. Root only.
uint64_t physicalMemoryOf(const std::vector<pid_t>& pids);

/// What a process is to be charged, by its `status` and `smaps`: anonymous memory that was not lazily freed,
/// shmem, swap, huge pages and dirty file pages, each as often as it maps them, and its page tables.
uint64_t chargeOf(pid_t pid);

/// Anonymous memory, mapped shmem, swap, huge pages in use and page tables, of the whole system.
uint64_t memoryInUse();

/// Start and end of the largest mapping.
struct AddressRange {
    uint64_t start = 0;
    uint64_t end = 0;
};
AddressRange largestMapping(pid_t pid);
