#pragma once

#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <tl/expected.hpp>

#include "platform/MWError.h"

/// Why a file is no snapshot that can be read. Errors of the file system have the domain of their own, with
/// errno as the code.
inline constexpr const char* HeapsnapReaderError = "HeapsnapReaderError";
inline constexpr const char* MWFileError = "MWFileError";

/// The process that a snapshot was taken of.
struct HeapsnapProcess {
    int32_t pid = 0;
    std::string name;
    bool is64bit = false;
    std::string description;   ///< carries the architecture, and "(translated)"
    std::string binaryImages;  ///< free text
    bool hasSharedCache = true;
    uint32_t pageSize = 0;       ///< bytes, never 0
    uint64_t physMemweight = 0;  ///< what the kernel charged, bytes
    uint64_t physMemweightPeak = 0;
    bool breakdown = false;  ///< recorded in the mode that breaks the charge down
};

/// Sizes in bytes.
struct HeapsnapRegion {
    uint64_t start = 0;
    uint64_t length = 0;
    uint64_t offset = 0;
    uint64_t resident = 0;
    uint64_t sharedNowPrivate = 0;
    uint64_t swappedOut = 0;
    uint64_t dirty = 0;
    uint64_t reusable = 0;
    uint64_t objectId = 0;
    uint32_t protection = 0;
    uint32_t maxProtection = 0;
    uint32_t userTag = 0;
    uint32_t submap = 0;
    uint32_t purgeState = 3;
    uint16_t referenceCount = 0;
    uint8_t shareMode = 2;
    bool externalPager = false;
    /// An image segment's name or a kind of memory; shared by regions of the same. Never null.
    std::shared_ptr<const std::string> type;
    std::shared_ptr<const std::string> path;  ///< of the mapped file
};

/// One process's memory, from a JSON document that docs/heapsnap.md describes. Whatever is not such a
/// document is refused with one sentence that tells the place.
class HeapsnapReader {
public:
    using Result = tl::expected<std::unique_ptr<HeapsnapReader>, MWError>;
    /// Fills a part of the buffer from its beginning and answers how much; 0 at the end.
    using Source = std::function<size_t(char* buffer, size_t size)>;

    static Result open(std::string_view bytes);
    /// Read piece by piece: memory goes by the number of regions, whatever the length. A path to anything
    /// but a regular file is refused.
    static Result openFile(const std::string& path);

    const HeapsnapProcess& process() const { return _process; }
    /// Ascending, without overlaps, until `visit` answers true.
    void enumerateRegions(const std::function<bool(const HeapsnapRegion&)>& visit) const;

private:
    HeapsnapReader() = default;
    static Result _read(const Source& source);

    HeapsnapProcess _process;
    std::deque<HeapsnapRegion> _regions;
};
