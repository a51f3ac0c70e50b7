#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/MWHostRecords.h"
#include "process/MWImage.h"
#include "process/MWProcess.h"

class MWImageDescription;

/// One region as the walk reports it.
struct MWWalkedRegion {
    uint64_t address = 0;
    uint64_t size = 0;
    vm_region_submap_info_64 info = {};
    int32_t purgeState = VM_PURGABLE_DENY;
    std::optional<std::string> path = {};  ///< of the mapped file
    std::optional<std::string> name = {};  ///< given by the source of the regions; a live walk gives none
    bool verbose = false;
};

/// Answers whether the walk must stop.
using MWRegionCallback = std::function<bool(const MWWalkedRegion&)>;

/// The disposition words of consecutive pages; chunk `index` of `count`.
struct MWDispositionChunk {
    std::span<const int32_t> words;
    uint64_t index;
    uint64_t count;
};

struct MWDispositionQuery {
    uint64_t pagesToQuery;
    std::function<void(const MWDispositionChunk&)> block;
};

struct MWSharedRegionMapping {
    uint64_t forRegionInSharedRegionStartingAt;
    uint64_t withSize;
    const vm_region_submap_info_64& withRegionInfo;
    MWImageEnumerator& imageEnumerator;
};

struct MWExpectedError {
    kern_return_t expectingErrorOnExit;
};

/// Where a platform keeps its rtld shared cache.
enum MWPlatformCode : int {
    MWPlatformX86 = 0,
    MWPlatformX86_64 = 1,
    MWPlatformArm = 2,
    MWPlatformArm64 = 3,
    MWPlatformArm64_32 = 4,
    MWPlatformUnknown = 5,
    MWPlatformNoSharedCache = 6,
};

/// Kernel objects that a process owns, by object identifier.
using MWOwnedObjects = std::map<uint64_t, OwnedObjectRecord>;

/// A live user process. Holds its task from creation to destruction. Gathering walks the address space once
/// and turns every region record into a region; what the kernel refuses becomes a message of the process.
///
/// Every step can be replaced, for processes whose data comes from elsewhere.
class MWUserProcess : public MWProcess {
public:
    /// None when the task is refused; the reason is then already on standard error.
    static std::shared_ptr<MWUserProcess> initWithBsdInfo(const proc_bsdinfo& info);
    ~MWUserProcess() override;
    MWUserProcess(const MWUserProcess&) = delete;
    MWUserProcess& operator=(const MWUserProcess&) = delete;

    /// Announces the process to the host, with what it owns where it will be asked for that.
    void prepareToGatherData() override;
    bool takesLongToGather() const override { return _physMemweight >= kLargeProcess; }
    /// Does nothing for a process that has its regions.
    void gatherData() override;
    /// Whether the gathered regions can be joined once more: where other processes hold other pages of one,
    /// the first joining uses up what tells them apart. Known once gathered.
    bool canBeAnalyzedAgain() const { return _canBeAnalyzedAgain; }
    /// Whether `other` stands for the same process: a pid alone can have been given away.
    bool isSameProcess(const MWUserProcess& other) const {
        return pid() == other.pid() && _startTime == other._startTime;
    }
    /// "phys_memweight" and "phys_memweight_peak", which are not added up over processes; none for a process
    /// without a charge.
    MWAuxDataTree auxData() const override;
    /// What the kernel charges the process in all, in bytes; 0 when it does not tell.
    uint64_t phys_memweight() const { return _physMemweight; }
    void setPhys_memweight(uint64_t bytes) { _physMemweight = bytes; }
    bool _isAlive() const override { return true; }
    bool _populateTask() override;

protected:
    MWUserProcess() = default;

    bool _initWithBsdInfo(const proc_bsdinfo& info) override;
    /// A live process runs as what it is on this platform.
    virtual void _gatherIsTranslated() {}
    /// False: the page size of the data is unusable and the process is skipped.
    virtual bool _configurePageSize() { return true; }

    // Figures of the kernel that no region shows.

    /// The charge and its peak; what cannot be read stays as it was.
    virtual void _gatherPhysMemweight();
    virtual void _gatherLedgers();
    /// None when the kernel does not list owned objects, or is not asked to.
    virtual std::optional<MWOwnedObjects> _gatherOwnedVmObjects();
    virtual void _gatherIdleExitStatus();
    virtual void _setIdleExitStatusFromDirtyFlags(uint32_t flags);

    // Images and the rtld shared cache.

    /// Fills `_images` from one listing of the images that are loaded now.
    virtual void _gatherImageData();
    /// Whether processes of the system that it runs on, or ran on, have a shared cache.
    virtual bool _hasSharedCache() const;
    /// Chooses the shared cache's place by platform; false for MWPlatformUnknown.
    virtual bool _setSharedRegionFromPlatform(int platformCode);
    /// Cuts one shared-cache mapping into a region for each image segment and one for each stretch between
    /// them, and appends these to `regions`; false when one could not be measured. Text and linkedit pieces
    /// are nobody's to write and are not measured.
    virtual bool _addRegionsToArray(MWMemoryRegionList& regions, const MWSharedRegionMapping& mapping);
    bool _isInSharedCache(uint64_t address) const { return address - _sharedRegionBase < _sharedRegionSize; }

    // The region walk.

    /// Calls back once for every region, by ascending address; a submap's regions are reported in its
    /// place, but a shared-cache mapping whole. Costs one kernel query per region.
    virtual void enumerateRegions(const MWRegionCallback& callback);
    /// The start of the last region below the shared cache, to 16 MiB; 0 when there is no such boundary.
    virtual uint64_t _lastNonSharedCacheRegion();

    // Page dispositions.

    /// Calls back with the disposition words of the pages from `startAddress` on, at most 4096 at a time.
    /// False when a query failed; the failure is filed and what was delivered before stays delivered.
    virtual bool _enumerateDispositionChunksWithStartAddr(uint64_t startAddress,
                                                          const MWDispositionQuery& query);
    /// Sets the dirty and swapped sizes of a shared-cache region, which are 0, from its pages. A page that
    /// two neighbours share is queried once and each is charged its own bytes of it, so neighbours come in
    /// ascending order.
    virtual bool _populateMemoryRegionWithPageQueries(const std::shared_ptr<MWMemoryRegion>& region,
                                                      const vm_region_submap_info_64& regionInfo);
    /// Records page-exact runs of one kind in the region's sub-range list. Exclusively owned memory has none:
    /// nobody else can see another part of it.
    virtual void _addSubrangesForRegion(MWMemoryRegion& region, int32_t purgeState);

    /// Walks the regions and settles what is owned without being mapped; sets `memoryRegions`.
    virtual void _gatherMemoryData();

    // Messages.

    /// Files a kernel failure: as a warning when it is the one to expect of an exiting process and the
    /// process is gone indeed, else as an error.
    virtual void _processMachVMError(kern_return_t result, MWExpectedError expected);
    /// Prints and files a warning with the text of errno.
    virtual void _addErrnoWarningWithDescription(std::string_view description);
    /// Files what the host finds doubtful about the regions that it reported.
    void _addTaskWarnings();
    void _printBailingOut() const;

    // What the steps share.

    std::optional<task_t> _task;
    uint64_t _sharedRegionBase = 0;
    uint64_t _sharedRegionSize = 0;
    uint32_t _sharedRegionAlignmentSize = 0;  ///< of images inside the shared cache
    uint64_t _phys_memweight_peak = 0;        ///< over the life of the process, bytes
    /// Bytes of page tables.
    std::array<uint64_t, 1> _ledgers = {};
    /// Present only while gathering.
    std::shared_ptr<MWImageList> _images;
    /// Absent where the kernel did not tell. Mapped regions claim their entries while regions are gathered.
    std::optional<MWOwnedObjects> _ownedVmObjects;
    /// The last page of the region measured last, when the region ends within it.
    uint64_t _cachedDispositionAddress = 0;
    int32_t _cachedDisposition = 0;
    /// A shared-cache gap whose share of its last page awaits the disposition of that page.
    std::shared_ptr<MWMemoryRegion> _pendingUnusedSharedRegion;

private:
    struct MemoryGathering;
    struct SharedPageCharge;
    struct SharedMappingSplit;
    enum class WalkStep : uint8_t { end, region, sharedMapping, notShared };

    /// Owned objects have a use: they are asked for, in this mode, of a process that is displayed.
    bool _asksForOwnedVmObjects() const;
    std::optional<std::vector<std::byte>> _fetchOwnedVmObjects();

    int _platformCode() const;
    MWSharedText _ownerPath(const MWImageDescription& image) const;

    // The next piece of a shared-cache mapping, at the cursor; false when it could not be measured.
    bool _addSharedCacheGap(SharedMappingSplit& split);
    bool _addSharedCacheImagePiece(SharedMappingSplit& split);

    // Classification of one walked region; `gathering` is the state of the walk so far.
    bool _classifyRegion(MemoryGathering& gathering, const MWWalkedRegion& walked);
    bool _classifySharedCacheMapping(MemoryGathering& gathering, const MWWalkedRegion& walked);
    void _setSizes(MWMemoryRegion& region, const MWWalkedRegion& walked, bool breakDown) const;
    void _nameRegion(MemoryGathering& gathering, MWMemoryRegion& region, const MWWalkedRegion& walked);
    void _matchOwnedObject(MemoryGathering& gathering, MWMemoryRegion& region, const MWWalkedRegion& walked);
    void _appendLeftoverOwnedObjects(MWMemoryRegionList& regions);
    void _settleHolder(MemoryGathering& gathering);

    // One step of the walk: each fills `region` with the first region at or above its address.
    WalkStep _nextRegion(uint64_t boundary, MWWalkedRegion& region);
    WalkStep _querySharedMapping(uint64_t boundary, MWWalkedRegion& region);
    WalkStep _queryRecursively(MWWalkedRegion& region);
    WalkStep _endWalk(kern_return_t result, std::string_view label);
    bool _leadsOnFrom(uint64_t address, const MWWalkedRegion& region);
    void _gatherRegionDetails(MWWalkedRegion& region) const;

    void _chargeSharedPage(SharedPageCharge& measured, int32_t word);
    void _creditPendingGap(const MWMemoryRegion& nextRegion, int32_t word);

    static constexpr uint64_t kLargeProcess = uint64_t{256} << 20U;
    uint64_t _physMemweight = 0;
    bool _canBeAnalyzedAgain = false;
    std::pair<uint64_t, uint64_t> _startTime;  ///< seconds and microseconds
};
