#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "analysis/MWMemoryObjectMaps.h"
#include "analysis/MWProcessGroup.h"
#include "model/MWMemoryCategory.h"
#include "output/MWOutputFormatter.h"
#include "output/MWTime.h"
#include "platform/MWInterruptSource.h"
#include "platform/MWWorkQueue.h"
#include "process/MWProcess.h"

using MWProcessList = std::vector<std::shared_ptr<MWProcess>>;
/// Processes that the analysis object owns, in an order that means something.
using MWProcessOrder = std::vector<const MWProcess*>;
/// The groups that each process belongs to, by `asNumber`: its private group first, when it has one, then the
/// shared ones by number of members and by the members' pids.
using MWProcessToProcessGroups = std::map<int64_t, std::vector<std::shared_ptr<MWProcessGroup>>>;

/// Whether a process sees the objects of a table as they are.
enum MWProcessViewState : uint8_t {
    ProcessViewImpossible = 0,  ///< no object can look different to any process
    ProcessViewPossible = 1,    ///< some object can, but this process sees every object whole
    ProcessViewDiffers = 2,     ///< this process sees a part of at least one object
};

/// Whose table is built, and how.
struct MWCategoriesCall {
    const MWProcess& viewedByProcess;
    /// Receives the state; may be null.
    MWProcessViewState* hasProcessView;
    /// Rows by short name; by full name otherwise.
    bool summarize;
};

/// One measurement: gathers its processes concurrently, joins their regions into memory objects, charges
/// and groups them, and drives the formatters. Created, gathered, analyzed, printed, discarded, in this
/// order, each step once; everything after gathering runs on the caller's thread.
///
/// Hidden processes (`hiddenFromDisplay`) are gathered and joined like the others and otherwise show only as
/// sharers of memory that a displayed process owns.
class MWMemweight {
public:
    /// (initWithProcesses:)
    explicit MWMemweight(MWProcessList processes);

    /// The run-wide analysis mode, see MWPhysMemweightSwitch.
    static bool breakDownPhysMemweight();
    static void setBreakDownPhysMemweight(bool on);
    /// Delivers SIGINT to `handler` on a thread of its own until the source is cancelled or dies.
    static std::unique_ptr<MWInterruptSource> installCancelHandler(std::function<void()> handler);

    const MWProcessList& processes() const { return _processes; }
    /// Taken just before and just after gathering; absent before, or when the host refuses its clocks.
    const std::optional<MWTime>& gatherStartTime() const { return _gatherStartTime; }
    const std::optional<MWTime>& gatherEndTime() const { return _gatherEndTime; }
    /// Scheduling class of the gathering threads; to be set before gatherData.
    uint32_t qualityOfService() const { return _qualityOfService; }
    void setQualityOfService(uint32_t qualityOfService) { _qualityOfService = qualityOfService; }

    /// True when gathering stopped early because of `cancel`.
    bool gatherData();
    /// Processes that are not being gathered yet will not be. Safe from any thread, at any time, any number
    /// of times.
    void cancel() { _gathering->earlyExit = true; }
    void analyzeData();
    /// Not owned; must outlive this object.
    void addOutputFormatter(MWOutputFormatter& formatter) { _outputFormatters.push_back(&formatter); }

    struct OutputForm {
        bool verbose;
        bool summarize;
    };
    /// The whole output of the measurement. Releases what only the analysis needed.
    void printOutputVerbose(OutputForm form);
    void printSpanlistLikeOutputForProcesses(const MWProcessOrder& processes) const;

    // Internal operations.

    /// Bytes charged to each displayed process, by pid.
    const std::map<int32_t, uint64_t>& pidToMemweight() const { return _pidToMemweight; }
    /// Highest pid first.
    static MWProcessList _processesBySortingPidDesc(MWProcessList processes);
    /// Largest charge first, then highest pid first.
    MWProcessOrder _processesBySortingMemweight(MWProcessOrder processes) const;
    /// The displayed processes, in list order.
    MWProcessOrder _notHiddenProcesses() const;

    void _addProcess(const MWProcess& process);
    void finalizeObjects();
    uint64_t _calculateMemweightForProcess(const MWProcess& process) const;
    void _buildProcessToMemweightMap();

    /// To be called while the object maps are still there.
    MWProcessToProcessGroups _generateProcessToProcessGroups() const;
    /// The objects as the process sees them, each added once.
    static MWCategoryTable _categoriesForObjects(const MWProcessGroup::Objects& objects,
                                                 const MWCategoriesCall& call);
    /// Every object that a displayed process maps, once and whole.
    MWCategoryTable _categoriesForAllProcessesShouldSummarize(bool summarize) const;
    static void _totalForCategories(const MWCategoryTable& categories, MWCategoryTotals& outTotal);

private:
    /// What the gathering threads share, be it for longer than there is a measurement.
    struct Gathering {
        std::atomic<bool> earlyExit = false;
        std::atomic<bool> stoppedEarly = false;  ///< a process was left out for it
    };
    using GatheringStep = std::function<void(MWProcess&)>;

    static MWProcessList _longestFirst(MWProcessList processes);
    /// `bytesKept` of each process, for the time being.
    void _replaceUnresponsive(const std::shared_ptr<MWProcess>& stuck);
    MWProcessList _takeStep(const MWProcessList& processes, size_t bytesKept, const GatheringStep& step);

    struct Messages {
        MWProcessOrder processesWithWarnings;
        MWProcessOrder processesWithErrors;
        std::vector<std::string> globalErrors;
    };

    /// The process's regions; none for a process that was not gathered.
    static const MWMemoryRegionList& _regionsOf(const MWProcess& process);

    static Messages _collectMessages(const MWProcessOrder& processes);
    void _printProcess(const MWProcess& process, bool summarize) const;
    void _printProcessHead(const MWProcess& process, bool hasErrors) const;
    void _printGroup(const MWProcess& process, MWProcessGroup& group, bool summarize) const;
    void _printSummary(const MWProcessOrder& processes, bool summarize) const;

    MWProcessList _processes;
    std::map<int32_t, uint64_t> _pidToMemweight;
    /// From analyzeData until the process groups are formed. The objects that are reported live on in the
    /// groups. Those that only hidden processes map do not: the regions of hidden processes then refer to
    /// objects that are gone, and nobody may follow them any more.
    std::optional<MWMemoryObjectMaps> _objectMaps;
    MWProcessToProcessGroups _groupsOf;
    size_t _objectCount = 0;  ///< of the analysis, also when the maps are gone
    std::vector<MWOutputFormatter*> _outputFormatters;
    std::shared_ptr<Gathering> _gathering = std::make_shared<Gathering>();
    uint32_t _qualityOfService = QOS_CLASS_UTILITY;
    std::optional<MWTime> _gatherStartTime;
    std::optional<MWTime> _gatherEndTime;
};
