#include "analysis/MWMemweight.h"

namespace {

/// From this size on a table that all members see alike is built once instead of once per member.
constexpr size_t kMembersWorthCaching = 26;

/// The host's clocks do not fail in practice; if they do, the report is dated 1970 rather than lost.
MWTime timeOrEpoch(const std::optional<MWTime>& time) {
    return time.value_or(MWTime(MWClockReading{}));
}

/// The trees of all processes without errors, merged.
MWAuxDataTree mergedAuxData(const MWProcessOrder& processes) {
    MWAuxDataTree merged;
    for (const MWProcess* process : processes) {
        const MWAuxDataTree auxData = process->auxData();
        if (process->errors().empty() && auxData) {
            merged = auxData->mergeWithData(merged.get());
        }
    }
    return merged;
}

}  // namespace

void MWMemweight::printOutputVerbose(OutputForm form) {
    const MWProcessOrder processes = _processesBySortingMemweight(_notHiddenProcesses());
    for (MWOutputFormatter* formatter : _outputFormatters) {
        formatter->startAtTime(timeOrEpoch(_gatherStartTime));
    }
    if (form.verbose) {
        printSpanlistLikeOutputForProcesses(processes);
    }
    // The groups hold the objects from here on.
    _groupsOf = _generateProcessToProcessGroups();
    _objectMaps.reset();
    for (const MWProcess* process : processes) {
        _printProcess(*process, form.summarize);
    }
    _printSummary(processes, form.summarize);
}

void MWMemweight::printSpanlistLikeOutputForProcesses(const MWProcessOrder& processes) const {
    for (const MWProcess* process : processes) {
        for (MWOutputFormatter* formatter : _outputFormatters) {
            formatter->printSpanlistLikeOutputForProcess(*process, _regionsOf(*process));
        }
    }
}

void MWMemweight::_printProcess(const MWProcess& process, bool summarize) const {
    const bool hasErrors = !process.errors().empty();
    _printProcessHead(process, hasErrors);
    const auto groups = _groupsOf.find(process.asNumber());
    if (hasErrors || groups == _groupsOf.end()) {
        for (MWOutputFormatter* formatter : _outputFormatters) {
            formatter->printProcessCategories(MWCategoryTable(), MWCategoryTotals());
        }
    } else {
        for (const auto& group : groups->second) {
            _printGroup(process, *group, summarize);
        }
    }
    const MWAuxDataTree auxData = process.auxData();
    for (MWOutputFormatter* formatter : _outputFormatters) {
        formatter->printProcessAuxData(auxData);
    }
}

void MWMemweight::_printProcessHead(const MWProcess& process, bool hasErrors) const {
    const uint64_t memweight = _pidToMemweight.at(process.pid());
    for (MWOutputFormatter* formatter : _outputFormatters) {
        formatter->printProcessHeader(process);
        if (!hasErrors) {
            formatter->printProcessTotal(memweight, process);
        }
        formatter->endProcessHeader(process);
    }
}

void MWMemweight::_printGroup(const MWProcess& process, MWProcessGroup& group, bool summarize) const {
    const size_t members = group.processes().size();
    MWProcessViewState state = ProcessViewImpossible;
    MWProcessGroup::Categories categories = group.consumeCachedCategories();
    if (!categories) {
        categories = std::make_shared<MWCategoryTable>(_categoriesForObjects(
            *group.objects(),
            {.viewedByProcess = process, .hasProcessView = &state, .summarize = summarize}));
        if (state == ProcessViewImpossible && members >= kMembersWorthCaching) {
            group.attachCachedCategories(categories, static_cast<uint32_t>(members - 1));
        }
    }
    MWCategoryTotals total;
    _totalForCategories(*categories, total);
    for (MWOutputFormatter* formatter : _outputFormatters) {
        if (members == 1) {
            formatter->printProcessCategories(*categories, total);
        } else {
            formatter->printSharedCategories(*categories, {.sharedWith = group,
                                                           .forProcess = process,
                                                           .hasProcessView = state == ProcessViewDiffers,
                                                           .total = total});
        }
    }
}

void MWMemweight::_printSummary(const MWProcessOrder& processes, bool summarize) const {
    const Messages messages = _collectMessages(processes);
    for (MWOutputFormatter* formatter : _outputFormatters) {
        formatter->printProcessesWithWarnings(
            messages.processesWithWarnings,
            {.processesWithErrors = messages.processesWithErrors, .globalErrors = messages.globalErrors});
    }
    const MWCategoryTable summary = _categoriesForAllProcessesShouldSummarize(summarize);
    MWCategoryTotals total;
    _totalForCategories(summary, total);
    const bool hadErrors = !messages.globalErrors.empty() || !messages.processesWithErrors.empty();
    const MWAuxDataTree auxData = mergedAuxData(processes);
    for (MWOutputFormatter* formatter : _outputFormatters) {
        formatter->printSummaryCategories(summary, {.total = total, .hadErrors = hadErrors});
        formatter->printGlobalAuxData(auxData);
        formatter->endAtTime(timeOrEpoch(_gatherEndTime));
    }
}

MWMemweight::Messages MWMemweight::_collectMessages(const MWProcessOrder& processes) {
    Messages messages;
    for (const MWProcess* process : processes) {
        if (!process->warnings().empty()) {
            messages.processesWithWarnings.push_back(process);
        }
        if (!process->errors().empty()) {
            messages.processesWithErrors.push_back(process);
        }
        const auto& globalErrors = process->globalErrors();
        messages.globalErrors.insert(messages.globalErrors.end(), globalErrors.begin(), globalErrors.end());
    }
    return messages;
}
