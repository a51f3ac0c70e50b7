#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

/// What the text of `fdinfo/N` tells of kernel objects that hold memory; one function for each kind. Values
/// are "KEY:<blanks>NUMBER[ KiB| MiB| GiB]", bytes without a unit; lines that are cut or of another unit are
/// passed over.
namespace procfs {

/// A client of a graphics or accelerator device, and its buffers that lie in system memory, in bytes. Memory
/// of the device itself (vram, local) is none of the system's.
struct DrmClient {
    std::string device;       ///< bus address, or the driver where the device has none
    uint64_t identifier = 0;  ///< one for each opening of the device; descriptors that are copies share it
    uint64_t total = 0;
    uint64_t resident = 0;
    uint64_t purgeable = 0;  ///< of the resident bytes
};
/// None when the text is not a client's, or of a driver that does not number its clients.
std::optional<DrmClient> parseDrmClient(std::string_view fdinfo);

/// A buffer that devices share.
struct DmaBuffer {
    uint64_t size = 0;
    bool fromVideoDevice = false;
};
std::optional<DmaBuffer> parseDmaBuffer(std::string_view fdinfo);

struct BpfMap {
    uint64_t identifier = 0;
    uint64_t memory = 0;  ///< what the kernel charges for it
};
std::optional<BpfMap> parseBpfMap(std::string_view fdinfo);

}  // namespace procfs
