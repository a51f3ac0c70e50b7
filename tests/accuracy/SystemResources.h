#pragma once

#include <cstdint>
#include <filesystem>
#include <string>

/// Changes to the system for one test, undone with their owner.

/// A directory below `parent`, deleted with all that is in it.
class TemporaryDirectory {
public:
    explicit TemporaryDirectory(const std::filesystem::path& parent);
    ~TemporaryDirectory();
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    std::filesystem::path operator/(const char* name) const { return _path / name; }

private:
    std::filesystem::path _path;
};

/// A swap file in use. Declared before the workloads that use it, so that little has to come back from it.
class SwapFile {
public:
    explicit SwapFile(uint64_t bytes);
    ~SwapFile();
    SwapFile(const SwapFile&) = delete;
    SwapFile& operator=(const SwapFile&) = delete;

    /// Not where the kernel or a container refuses.
    bool isUsed() const { return _isUsed; }

private:
    TemporaryDirectory _directory;
    std::string _path;
    bool _isUsed;
};

/// More huge pages in the kernel's pool.
class HugePages {
public:
    explicit HugePages(uint64_t pages);
    ~HugePages();
    HugePages(const HugePages&) = delete;
    HugePages& operator=(const HugePages&) = delete;

    /// Not where memory is too fragmented.
    bool areThere() const { return _areThere; }

private:
    uint64_t _before;
    bool _areThere;
};

/// A new file that everybody may read, with its pages in the page cache and clean.
void writeCleanFile(const std::filesystem::path& path, uint64_t bytes);
