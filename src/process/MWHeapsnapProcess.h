#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <tl/expected.hpp>

#include "platform/HeapsnapReader.h"
#include "platform/MWHostInterface.h"
#include "process/MWUserProcess.h"

/// Codes of MWError in the domain MemweightErrorDomain.
inline constexpr const char* MemweightErrorDomain = "MemweightErrorDomain";
enum MWHeapsnapErrorCode : int {
    MWErrorHeapsnapUnknown = 1,
    MWErrorHeapsnapPlatform = 2,
};

/// A process whose memory was saved to a file. The walk is fed from the file; whatever would ask about a
/// living process is switched off, so that it has neither page-exact figures nor owned memory that is not
/// mapped nor page tables.
class MWHeapsnapProcess : public MWUserProcess {
public:
    /// Errors of the reader and of the file are passed on; one without a description where the process was
    /// refused for no reason that could be told.
    static tl::expected<std::shared_ptr<MWHeapsnapProcess>, MWError> processWithHeapsnap(
        const std::string& path);

    const HeapsnapReader& graph() const { return *_graph; }
    void setGraph(std::unique_ptr<HeapsnapReader> graph) { _graph = std::move(graph); }

    bool breakDownPhysMemweight() const override { return _graph->process().breakdown; }
    uint64_t _gatherPageSize() override { return _graph->process().pageSize; }
    bool _populateTask() override { return true; }
    bool _isAlive() const override { return false; }
    void prepareToGatherData() override { MWHostInterface::current().surveySavedProcess(); }

protected:
    explicit MWHeapsnapProcess(std::unique_ptr<HeapsnapReader> graph) : _graph(std::move(graph)) {}

    void _gatherIsTranslated() override;
    bool _configurePageSize() override { return true; }
    void _gatherPhysMemweight() override;
    std::optional<MWOwnedObjects> _gatherOwnedVmObjects() override { return std::nullopt; }
    /// Images are met with the regions.
    void _gatherImageData() override {}
    bool _hasSharedCache() const override { return _graph->process().hasSharedCache; }
    void enumerateRegions(const MWRegionCallback& callback) override;
    bool _populateMemoryRegionWithPageQueries(const std::shared_ptr<MWMemoryRegion>& region,
                                              const vm_region_submap_info_64& regionInfo) override;
    void _addSubrangesForRegion(MWMemoryRegion&, int32_t) override {}

private:
    /// The error is empty where the process is refused without one.
    using Initialized = tl::expected<void, MWError>;
    Initialized _initWithHeapsnap();
    MWPlatformCode _platformFromDescription() const;
    vm_region_submap_info_64 _recordOf(const HeapsnapRegion& region) const;
    void _collectImage(std::optional<MWImage>& pending, const HeapsnapRegion& region);

    std::unique_ptr<HeapsnapReader> _graph;
};
