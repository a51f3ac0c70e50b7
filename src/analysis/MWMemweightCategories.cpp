#include <tsl/robin_set.h>

#include <algorithm>
#include <numeric>

#include "analysis/MWMemweight.h"

namespace {

using ObjectSet = tsl::robin_set<const MWMemoryObject*>;

/// The row that the object belongs to, whatever part of it is seen.
MWMemoryCategory& categoryForObject(MWCategoryTable& table, const MWMemoryObject& object, bool summarize) {
    return table.try_emplace(summarize ? object.name() : object.fullName(), summarize).first->second;
}

uint64_t chargeOfRegions(const MWMemoryRegionList& regions) {
    return std::accumulate(regions.begin(), regions.end(), uint64_t{0},
                           [](uint64_t charge, const auto& region) {
                               return charge + region->dirtySize() + region->swappedSize();
                           });
}

/// Every object is charged in full, however many processes share it.
uint64_t chargeOfWholeObjects(const MWMemoryRegionList& regions) {
    ObjectSet counted;
    uint64_t charge = 0;
    for (const auto& region : regions) {
        const MWMemoryObject* object = region->memoryObject();
        if (counted.insert(object).second) {
            charge += object->totalDirtySize() + object->totalSwappedSize();
        }
    }
    return charge;
}

}  // namespace

uint64_t MWMemweight::_calculateMemweightForProcess(const MWProcess& process) const {
    const MWMemoryRegionList& regions = _regionsOf(process);
    return breakDownPhysMemweight() ? chargeOfRegions(regions) : chargeOfWholeObjects(regions);
}

void MWMemweight::_buildProcessToMemweightMap() {
    _pidToMemweight.clear();
    for (const MWProcess* process : _notHiddenProcesses()) {
        _pidToMemweight[process->pid()] = _calculateMemweightForProcess(*process);
    }
}

MWProcessOrder MWMemweight::_processesBySortingMemweight(MWProcessOrder processes) const {
    const auto rank = [this](const MWProcess* process) {
        return std::pair(_pidToMemweight.at(process->pid()), process->pid());
    };
    std::ranges::stable_sort(processes, std::ranges::greater(), rank);
    return processes;
}

MWCategoryTable MWMemweight::_categoriesForObjects(const MWProcessGroup::Objects& objects,
                                                   const MWCategoriesCall& call) {
    MWCategoryTable table;
    MWProcessViewState state = ProcessViewImpossible;
    for (const auto& object : objects) {
        const auto view = object->viewForProcess(call.viewedByProcess);
        categoryForObject(table, *object, call.summarize).addMemoryObject(view);
        if (view != object) {
            state = ProcessViewDiffers;
        } else if (state == ProcessViewImpossible && object->couldHaveProcessView()) {
            state = ProcessViewPossible;
        }
    }
    if (call.hasProcessView != nullptr) {
        *call.hasProcessView = state;
    }
    return table;
}

MWCategoryTable MWMemweight::_categoriesForAllProcessesShouldSummarize(bool summarize) const {
    MWCategoryTable table;
    std::vector<bool> counted(_objectCount);
    for (const MWProcess* process : _notHiddenProcesses()) {
        for (const auto& region : _regionsOf(*process)) {
            const MWMemoryObject* object = region->memoryObject();
            if (!counted[object->ordinal()]) {
                counted[object->ordinal()] = true;
                categoryForObject(table, *object, summarize).addMemoryObject(object->shared_from_this());
            }
        }
    }
    return table;
}

void MWMemweight::_totalForCategories(const MWCategoryTable& categories, MWCategoryTotals& outTotal) {
    outTotal = {};
    for (const auto& [key, category] : categories) {
        outTotal.dirty += category.totalDirtySize();
        outTotal.swapped += category.totalSwappedSize();
        outTotal.clean += category.totalCleanSize();
        outTotal.reclaimable += category.totalReclaimableSize();
        outTotal.wired += category.totalWiredSize();
        outTotal.regions += static_cast<uint32_t>(category.totalRegions());
    }
}
