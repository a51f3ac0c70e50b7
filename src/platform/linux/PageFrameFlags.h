#pragma once

#include <cstdint>
#include <utility>

#include "platform/linux/Procfs.h"

/// `kpageflags`, the kernel's flags of each page frame: one file for the system, readable by root alone.
class PageFrameFlags {
public:
    explicit PageFrameFlags(procfs::Descriptor file) : _file(std::move(file)) {}

    bool readable() const { return static_cast<bool>(_file); }
    /// 0 when the frame is not known. Costs one read of 8 bytes.
    uint64_t flagsOfFrame(uint64_t frame) const;

    static constexpr uint64_t kDirty = uint64_t{1} << 4U;
    static constexpr uint64_t kAnonymous = uint64_t{1} << 12U;
    static constexpr uint64_t kSwapBacked = uint64_t{1} << 14U;
    static constexpr uint64_t kCompoundTail = uint64_t{1} << 16U;
    static constexpr uint64_t kZeroPage = uint64_t{1} << 24U;

private:
    procfs::Descriptor _file;
};
