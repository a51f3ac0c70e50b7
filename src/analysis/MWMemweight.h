#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <vector>

#include "analysis/MWProcessGroup.h"
#include "model/MWMemoryCategory.h"
#include "output/MWOutputFormatter.h"
#include "output/MWTime.h"
#include "platform/MWInterruptSource.h"
#include "process/MWProcess.h"

/// One measurement: gathers its processes concurrently, joins their regions into memory objects, charges
/// and groups them, and drives the formatters. Created, gathered, analyzed, printed, discarded, in this order,
/// each step once; everything after gathering runs on the caller's thread.
class MWMemweight {
public:
    // (the implementer completes)
    /// (initWithProcesses:)
    explicit MWMemweight(std::vector<std::shared_ptr<MWProcess>> processes);

    static bool breakDownPhysMemweight();
    static void setBreakDownPhysMemweight(bool on);
    static std::unique_ptr<MWInterruptSource> installCancelHandler(std::function<void()> handler);

    uint32_t qualityOfService() const;
    void setQualityOfService(uint32_t qualityOfService);
    /// True when gathering stopped early because of `cancel`.
    bool gatherData();
    /// Safe from any thread, at any time, any number of times.
    void cancel();
    void analyzeData();
    /// Not owned; must outlive this object.
    void addOutputFormatter(MWOutputFormatter& formatter);

    struct OutputForm {
        bool verbose;
        bool summarize;
    };
    void printOutputVerbose(OutputForm form);
};
