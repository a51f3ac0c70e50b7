#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

// What the kernel tells of its own memory. Lines that cannot be read are passed over.

namespace procfs {

/// Figures by name.
class Figures {
public:
    /// 0 where the kernel does not tell it.
    uint64_t operator[](std::string_view name) const;
    uint64_t sum(std::initializer_list<std::string_view> names) const;
    void set(std::string_view name, uint64_t figure) { _figures.insert_or_assign(std::string(name), figure); }
    bool empty() const { return _figures.empty(); }

private:
    std::map<std::string, uint64_t, std::less<>> _figures;
};

/// `meminfo`, in bytes; lines that are no sizes are left out.
Figures parseMeminfo(std::string_view text);
/// `vmstat`: plain numbers.
Figures parseVmstat(std::string_view text);
/// Pages in the free lists of single processors, from `zoneinfo`.
uint64_t pagesInPerCpuLists(std::string_view zoneinfo);

/// A row of `slabinfo`.
struct SlabCache {
    std::string name;
    uint64_t activeObjects = 0;
    uint64_t objectSize = 0;  ///< bytes
    uint64_t pagesPerSlab = 0;
    uint64_t slabs = 0;
};
std::vector<SlabCache> parseSlabinfo(std::string_view text);

/// Who made an area of contiguous kernel addresses. Where the kernel has no symbols it tells the address.
struct VmallocCaller {
    std::string call;  ///< "FUNCTION+0xOFFSET/0xLENGTH", "... [MODULE]" or "0xADDRESS"; empty if not told

    /// "FUNCTION" or "FUNCTION [MODULE]"; empty where the kernel tells only an address, or nothing.
    std::string name() const;
    std::string function() const;
    uint64_t address() const;
    bool operator<(const VmallocCaller& other) const { return call < other.call; }
};
/// `vmallocinfo`: pages by caller. Areas that hold no memory of the kernel's are left out.
std::map<VmallocCaller, uint64_t> parseVmallocinfo(std::string_view text);

/// A row of `modules`.
struct LoadedModule {
    std::string name;
    uint64_t bytes = 0;
};
std::vector<LoadedModule> parseModules(std::string_view text);

/// A row of `allocinfo`: what one place in the kernel's source has allocated.
struct AllocationSite {
    uint64_t bytes = 0;
    std::string file;
    int line = 0;
    std::string module;  ///< empty for the kernel proper
    std::string function;
};
std::vector<AllocationSite> parseAllocinfo(std::string_view text);

}  // namespace procfs
