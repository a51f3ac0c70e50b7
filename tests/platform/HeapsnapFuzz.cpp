#include "platform/HeapsnapFuzz.h"

#include <cstdlib>
#include <string_view>

#include "platform/HeapsnapReader.h"

namespace {

void require(bool condition) {
    if (!condition) {
        std::abort();
    }
}

void checkRegions(const HeapsnapReader& reader) {
    uint64_t end = 0;
    bool isFull = false;
    reader.enumerateRegions([&](const HeapsnapRegion& region) {
        require(region.start >= end && (!isFull || region.length == 0));
        end = region.start + region.length;
        isFull = isFull || (end == 0 && region.length != 0);
        require(isFull || end >= region.start);
        end = isFull ? region.start : end;
        require(region.type != nullptr && region.path != nullptr);
        return false;
    });
}

}  // namespace

int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const auto reader = HeapsnapReader::open(std::string_view(reinterpret_cast<const char*>(data), size));
    if (!reader) {
        const auto& description = reader.error().description;
        require(description && !description->empty() && description->find('\n') == std::string::npos);
        return 0;
    }
    require((*reader)->process().pageSize != 0 && (*reader)->process().pid >= 0);
    checkRegions(**reader);
    return 0;
}
