#pragma once

#include <string>
#include <utility>
#include <vector>

#include "analysis/MWProcessGroup.h"
#include "output/MWOutputFormatter.h"
#include "process/MWProcess.h"

/// The parts of the totals that are not 0, by initial: "d4096 n1".
inline std::string describe(const MWCategoryTotals& total) {
    const std::pair<char, uint64_t> parts[] = {{'d', total.dirty}, {'s', total.swapped},
                                               {'c', total.clean}, {'r', total.reclaimable},
                                               {'w', total.wired}, {'n', total.regions}};
    std::string text;
    for (const auto& [initial, number] : parts) {
        if (number != 0) {
            text += (text.empty() ? "" : " ") + (initial + std::to_string(number));
        }
    }
    return text.empty() ? "0" : text;
}

/// "KEY d4096 n1; KEY c8192 n2" in order of key.
inline std::string describe(const MWCategoryTable& categories) {
    std::string text;
    for (const auto& [key, category] : categories) {
        const MWCategoryTotals sums = {
            category.totalDirtySize(), category.totalSwappedSize(),
            category.totalCleanSize(), category.totalReclaimableSize(),
            category.totalWiredSize(), static_cast<uint32_t>(category.totalRegions())};
        text += (text.empty() ? "" : "; ") + key + " " + describe(sums);
    }
    return text;
}

/// Writes each call down as one line.
class RecordingFormatter : public MWOutputFormatter {
public:
    explicit RecordingFormatter(std::vector<std::string>& log) : _log(log) {}

    void printProcessHeader(const MWProcess& process) override { _line("header " + process.displayString()); }
    void endProcessHeader(const MWProcess& process) override {
        _line("endHeader " + process.displayString());
    }
    void printProcessTotal(uint64_t memweight, const MWProcess& forProcess) override {
        _line("total " + std::to_string(memweight) + " of " + forProcess.displayString());
    }
    void printProcessCategories(const MWCategoryTable& categories, const MWCategoryTotals& total) override {
        _line("private {" + describe(categories) + "} = " + describe(total));
    }
    void printSharedCategories(const MWCategoryTable& categories,
                               const MWSharedCategoriesCall& call) override {
        _line("shared" + _names(call.sharedWith.processes()) + " for " + call.forProcess.name() +
              (call.hasProcessView ? " own view" : "") + " {" + describe(categories) +
              "} = " + describe(call.total));
    }
    void printProcessAuxData(const MWAuxDataTree& auxData) override { _line("aux" + _text(auxData)); }
    void printProcessesWithWarnings(const std::vector<const MWProcess*>& processes,
                                    const MWProcessErrors& errors) override {
        std::string line = "warnings" + _names(processes) + ", errors" + _names(errors.processesWithErrors);
        for (const std::string& error : errors.globalErrors) {
            line += ", global " + error;
        }
        _line(line);
    }
    void printSummaryCategories(const MWCategoryTable& categories, const MWSummaryCall& call) override {
        _line("summary {" + describe(categories) + "} = " + describe(call.total) +
              (call.hadErrors ? " with errors" : ""));
    }
    void printGlobalAuxData(const MWAuxDataTree& auxData) override { _line("globalAux" + _text(auxData)); }
    void endAtTime(const MWTime& time) override { _line("end " + std::to_string(time.machAbsoluteTime())); }
    void startAtTime(const MWTime& time) override {
        _line("start " + std::to_string(time.machAbsoluteTime()));
    }
    void printSpanlistLikeOutputForProcess(const MWProcess& process,
                                           const MWMemoryRegionList& regions) override {
        _line("listing " + process.name() + " " + std::to_string(regions.size()));
    }

private:
    void _line(const std::string& call) { _log.push_back(call); }
    static std::string _names(const std::vector<const MWProcess*>& processes) {
        std::string text;
        for (const MWProcess* process : processes) {
            text += " " + process->name();
        }
        return text;
    }
    static std::string _text(const MWAuxDataTree& auxData) {
        if (!auxData) {
            return " none";
        }
        std::string text;
        for (const auto& [name, datum] : auxData->elements()) {
            text += " " + name + "=" + std::to_string(static_cast<const MWAuxData&>(*datum).value());
        }
        return text;
    }

    std::vector<std::string>& _log;
};
