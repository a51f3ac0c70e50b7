#pragma once

#include <cstdint>
#include <filesystem>
#include <memory>

/// Changes to the system for one test, undone when they are let go.

/// A directory below `parent`, deleted with all that is in it.
std::shared_ptr<const std::filesystem::path> temporaryDirectory(const std::filesystem::path& parent);

/// A swap file in use; null where the kernel or a container refuses. Made before the workloads that use it,
/// so that little has to come back from it.
std::shared_ptr<const void> swapFile(uint64_t mebibytes);

/// More huge pages in the kernel's pool; null where memory is too fragmented.
std::shared_ptr<const void> hugePages(uint64_t pages);

/// A new file that everybody may read, with its pages in the page cache and clean.
void writeCleanFile(const std::filesystem::path& path, uint64_t mebibytes);
