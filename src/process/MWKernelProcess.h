#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "model/MWAuxData.h"
#include "platform/MWHostInterface.h"
#include "process/MWProcess.h"

/// Loaded extensions by load tag.
using MWKextMap = std::map<uint64_t, MWKernelExtension>;

/// The kernel as one process. Each zone of its allocator and each site that allocated memory becomes a region
/// without an address; figures that are nobody's memory become auxiliary data.
class MWKernelProcess : public MWProcess {
public:
    /// None when the base initialisation fails.
    static std::shared_ptr<MWKernelProcess> initWithBsdInfo(const proc_bsdinfo& info);

    /// The kernel needs no task.
    bool _populateTask() override { return true; }
    bool _isAlive() const override { return true; }
    /// Zones in zone order, then sites in record order. Asks anew each time.
    void gatherData() override;
    bool takesLongToGather() const override { return true; }
    /// "Maps": the kernel's counters by name, which are not added up over processes.
    MWAuxDataTree auxData() const override;

    struct ZoneNames {
        std::span<const mach_zone_name_t> zoneNames;
    };
    /// Turns each record into a region, which is appended to `regions`, or into auxiliary data.
    void _addWiredData(std::span<const mach_memory_info_t> records, ZoneNames zones,
                       MWMemoryRegionList& regions);

    static MWKextMap kextTags();
    static MWKextMap _kextTagsWithKextInfo(const std::vector<MWKernelExtension>& kextInfo);
    static std::unique_ptr<KernelSymbolicator> _createSymbolicator();

    /// What sites are named by.
    struct Naming {
        const MWKextMap& kexts;
        KernelSymbolicator& symbolicator;
        ZoneNames zones;
    };
    static std::string _nameForWiredInfo(const mach_memory_info_t& info, const Naming& naming);
    static void _setNameForRegion(MWMemoryRegion& region, const mach_memory_info_t& info,
                                  const Naming& naming);

protected:
    MWKernelProcess() = default;
    bool _initWithBsdInfo(const proc_bsdinfo& info) override;

private:
    void _addCounter(const mach_memory_info_t& info, const Naming& naming);
    void _printFailure(const char* operation, kern_return_t result) const;
    template <class Record>
    void _deallocate(std::span<const Record> records) const;

    std::map<std::string, MWAuxDatum> _auxData;
};
