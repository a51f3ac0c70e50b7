#include "platform/linux/Fdinfo.h"

#include <algorithm>
#include <map>

#include "platform/linux/ProcText.h"

namespace procfs {

namespace {

struct Line {
    std::string_view key;
    std::string_view value;  ///< without blanks around it
};

// The next line that has a key; false at the end of the text.
bool takeKeyedLine(std::string_view& text, Line& line) {
    while (!text.empty()) {
        const std::string_view whole = takeLine(text);
        const size_t colon = whole.find(':');
        if (colon != std::string_view::npos) {
            line = {whole.substr(0, colon), whole.substr(colon + 1)};
            skipBlanks(line.value);
            line.value = line.value.substr(0, line.value.find_last_not_of(" \t") + 1);
            return true;
        }
    }
    return false;
}

std::optional<uint64_t> bytesOf(std::string_view value) {
    struct Unit {
        std::string_view name;
        unsigned shift;
    };
    constexpr Unit kUnits[] = {{"", 0}, {"KiB", 10}, {"MiB", 20}, {"GiB", 30}};
    uint64_t number = 0;
    if (!takeNumber(value, number)) {
        return std::nullopt;
    }
    skipBlanks(value);
    const auto* unit = std::ranges::find(kUnits, value, &Unit::name);
    if (unit == std::end(kUnits) || number > UINT64_MAX >> unit->shift) {
        return std::nullopt;
    }
    return number << unit->shift;
}

bool isSystemMemory(std::string_view region) {
    if (region == "memory" || region == "gtt" || region == "cpu" || region.starts_with("system")) {
        return true;
    }
    return region.starts_with("stolen") && !region.starts_with("stolen-local");
}

/// What a driver states of one region; `memory` is an older name of `resident`.
struct DrmRegion {
    std::optional<uint64_t> total = {};
    std::optional<uint64_t> resident = {};
    std::optional<uint64_t> memory = {};
    std::optional<uint64_t> purgeable = {};
};
using DrmRegions = std::map<std::string_view, DrmRegion>;

void readRegionLine(const Line& line, DrmRegions& regions) {
    struct Figure {
        std::string_view prefix;
        std::optional<uint64_t> DrmRegion::*field;
    };
    constexpr Figure kFigures[] = {{"drm-total-", &DrmRegion::total},
                                   {"drm-resident-", &DrmRegion::resident},
                                   {"drm-memory-", &DrmRegion::memory},
                                   {"drm-purgeable-", &DrmRegion::purgeable}};
    for (const Figure& figure : kFigures) {
        std::string_view region = line.key;
        if (takePrefix(region, figure.prefix) && isSystemMemory(region)) {
            regions[region].*figure.field = bytesOf(line.value);
        }
    }
}

uint64_t plus(uint64_t sum, uint64_t more) {
    return more > UINT64_MAX - sum ? UINT64_MAX : sum + more;
}

void addRegion(DrmClient& client, const DrmRegion& region) {
    const uint64_t total = region.total.value_or(0);
    const uint64_t resident = region.resident ? *region.resident : (region.memory ? *region.memory : total);
    client.total = plus(client.total, std::max(total, resident));
    client.resident = plus(client.resident, resident);
    client.purgeable = plus(client.purgeable, std::min(region.purgeable.value_or(0), resident));
}

}  // namespace

std::optional<DrmClient> parseDrmClient(std::string_view fdinfo) {
    DrmClient client;
    DrmRegions regions;
    std::string_view driver;
    bool isNumbered = false;
    for (Line line; takeKeyedLine(fdinfo, line);) {
        if (line.key == "drm-driver") {
            driver = line.value;
        } else if (line.key == "drm-pdev") {
            client.device = line.value;
        } else if (line.key == "drm-client-id") {
            isNumbered = takeNumber(line.value, client.identifier);
        } else {
            readRegionLine(line, regions);
        }
    }
    if (driver.empty() || !isNumbered) {
        return std::nullopt;
    }
    if (client.device.empty()) {
        client.device = driver;
    }
    for (const auto& [name, region] : regions) {
        addRegion(client, region);
    }
    return client;
}

std::optional<DmaBuffer> parseDmaBuffer(std::string_view fdinfo) {
    std::optional<uint64_t> size;
    bool fromVideoDevice = false;
    for (Line line; takeKeyedLine(fdinfo, line);) {
        if (line.key == "name") {
            break;  // the process's own text, which can hold further lines
        }
        if (line.key == "size") {
            size = bytesOf(line.value);
        } else if (line.key == "exp_name") {
            for (const std::string_view exporter : {"v4l2", "vb2", "videobuf2"}) {
                fromVideoDevice |= line.value.find(exporter) != std::string_view::npos;
            }
        }
    }
    return size ? std::optional(DmaBuffer{*size, fromVideoDevice}) : std::nullopt;
}

std::optional<BpfMap> parseBpfMap(std::string_view fdinfo) {
    BpfMap map;
    bool isNumbered = false;
    for (Line line; takeKeyedLine(fdinfo, line);) {
        if (line.key == "map_id") {
            isNumbered = takeNumber(line.value, map.identifier);
        } else if (line.key == "memlock") {
            map.memory = bytesOf(line.value).value_or(0);
        }
    }
    return isNumbered ? std::optional(map) : std::nullopt;
}

}  // namespace procfs
