#include "output/MWOutputFormatterJSON.h"

#include <cstdio>

#include "analysis/MWProcessGroup.h"
#include "platform/MWHostInterface.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "process/MWProcess.h"

namespace {

void emitNumber(MWJSONWriter& json, std::string_view key, uint64_t value) {
    json.key(key);
    json.number(value);
}

void emitUnlessZero(MWJSONWriter& json, std::string_view key, uint64_t value) {
    if (value != 0) {
        emitNumber(json, key, value);
    }
}

void emitSigned(MWJSONWriter& json, std::string_view key, int64_t value) {
    json.key(key);
    json.number(value);
}

void emitStrings(MWJSONWriter& json, const std::vector<std::string>& strings) {
    for (const std::string& string : strings) {
        json.string(string);
    }
}

void emitMessages(MWJSONWriter& json, std::string_view key, const std::vector<std::string>& messages) {
    if (!messages.empty()) {
        json.key(key);
        json.beginArray();
        emitStrings(json, messages);
        json.endArray();
    }
}

/// "dirty" has what is swapped in it, as in every table.
void emitTotals(MWJSONWriter& json, const MWCategoryTotals& total) {
    json.beginObject();
    emitNumber(json, "dirty", total.dirty + total.swapped);
    emitNumber(json, "swapped", total.swapped);
    emitNumber(json, "clean", total.clean);
    emitNumber(json, "reclaimable", total.reclaimable);
    emitNumber(json, "wired", total.wired);
    emitNumber(json, "regions", total.regions);
    json.endObject();
}

/// (JSONForCategories:)
void emitCategories(MWJSONWriter& json, const MWCategoryTable& categories) {
    for (const auto& [name, category] : categories) {
        json.key(category.fullName());
        emitTotals(json, {.dirty = category.totalDirtySize(),
                          .swapped = category.totalSwappedSize(),
                          .clean = category.totalCleanSize(),
                          .reclaimable = category.totalReclaimableSize(),
                          .wired = category.totalWiredSize(),
                          .regions = static_cast<uint32_t>(category.totalRegions())});
    }
}

void emitCategoriesMember(MWJSONWriter& json, const MWCategoryTable& categories) {
    json.key("categories");
    json.beginObject();
    emitCategories(json, categories);
    json.endObject();
}

/// (JSONForAuxData:)
void emitAuxData(MWJSONWriter& json, const MWAuxDataType* datum) {
    if (datum == nullptr) {
        json.null();
    } else if (datum->isContainer()) {
        json.beginObject();
        for (const auto& [name, element] : static_cast<const MWAuxDataContainer&>(*datum).elements()) {
            json.key(name);
            emitAuxData(json, element.get());
        }
        json.endObject();
    } else {
        json.number(static_cast<const MWAuxData&>(*datum).value());
    }
}

/// "dirty" is here without what is swapped.
void emitRegion(MWJSONWriter& json, const MWMemoryRegion& region) {
    json.beginObject();
    emitNumber(json, "id", region.object_id());
    json.key("name");
    json.string(region.fullName());
    if (region.start() != MWNoAddress) {
        emitNumber(json, "addr", region.start());
    }
    emitNumber(json, "vsize", region.size());
    emitUnlessZero(json, "offset", region.offset());
    emitUnlessZero(json, "dirty", region.dirtySize());
    emitUnlessZero(json, "swapped", region.swappedSize());
    emitUnlessZero(json, "clean", region.cleanNonSpecSize());
    emitUnlessZero(json, "reclaimable", region.reclaimableSize());
    emitUnlessZero(json, "wired", region.wiredSize());
    json.endObject();
}

void emitRegions(MWJSONWriter& json, const MWProcess& process) {
    json.key("regions");
    json.beginArray();
    if (process.memoryRegions()) {
        for (const auto& region : *process.memoryRegions()) {
            emitRegion(json, *region);
        }
    }
    json.endArray();
}

}  // namespace

std::unique_ptr<MWOutputFormatterJSON> MWOutputFormatterJSON::initWithPath(const std::string& path) {
    auto file = MWOutputFile::create(path);
    if (file == nullptr) {
        std::perror("Unable to open JSON writer");
        return nullptr;
    }
    return std::unique_ptr<MWOutputFormatterJSON>(new MWOutputFormatterJSON(std::move(file)));
}

MWOutputFormatterJSON::MWOutputFormatterJSON(std::unique_ptr<MWOutputFile> file)
    : _file(std::move(file)), _json(_file.get()) {
    _json.beginObject();
    _json.key("unit");
    _json.string("byte");
    emitNumber(_json, "bytes per unit", 1);
    if (!MWPhysMemweightSwitch::isOn()) {
        _json.key("vm_object_dirty_analysis");
        _json.boolean(true);
    }
}

void MWOutputFormatterJSON::configureForMultipleOutputs() {
    _multipleOutputs = true;
    _json.key("samples");
    _json.beginArray();
}

void MWOutputFormatterJSON::startAtTime(const MWTime& time) {
    _shared = MWJSONWriter();
    _addedProcessGroups.clear();
    if (_multipleOutputs) {
        _json.beginObject();
    }
    _emitTimeObjectForTime(time, "start_time");
    _json.key("processes");
    _json.beginArray();
}

void MWOutputFormatterJSON::_emitTimeObjectForTime(const MWTime& time, std::string_view label) {
    _json.key(label);
    _json.beginObject();
    emitNumber(_json, "mach_absolute_time_ns", time.machAbsoluteTimeNsec());
    emitNumber(_json, "mach_continuous_time_ns", time.machContinuousTimeNsec());
    _json.key("wall_time_s");
    _json.number(time.wallTime());
    _json.key("date");
    _json.string(_dateFormatter.stringFromDate(time.date()));
    _json.endObject();
}

void MWOutputFormatterJSON::printSpanlistLikeOutputForProcess(const MWProcess&, const MWMemoryRegionList&) {
    _verbose = true;
}

void MWOutputFormatterJSON::printProcessHeader(const MWProcess& process) {
    _json.beginObject();
    _json.key("name");
    _json.string(process.name());
    emitSigned(_json, "pid", process.pid());
    _json.key("translated");
    _json.boolean(process.isTranslated());
    emitNumber(_json, "page size", process.pageSize());
    emitMessages(_json, "errors", process.errors());
    emitMessages(_json, "warnings", process.warnings());
    if (_verbose) {
        emitRegions(_json, process);
    }
    if (_pageSize == 0) {
        _pageSize = process.pageSize();
    }
}

void MWOutputFormatterJSON::printProcessTotal(uint64_t memweight, const MWProcess&) {
    emitNumber(_json, "memweight", memweight);
}

void MWOutputFormatterJSON::printProcessCategories(const MWCategoryTable& categories,
                                                   const MWCategoryTotals&) {
    emitCategoriesMember(_json, categories);
}

/// A group's common table is written once, the view that a process has of its own each time.
void MWOutputFormatterJSON::printSharedCategories(const MWCategoryTable& categories,
                                                  const MWSharedCategoriesCall& call) {
    if (!call.hasProcessView && !_addedProcessGroups.insert(&call.sharedWith).second) {
        return;
    }
    _shared.beginObject();
    _shared.key("pids");
    _shared.beginArray();
    for (const MWProcess* process : call.sharedWith.processes()) {
        _shared.number(int64_t{process->pid()});
    }
    _shared.endArray();
    if (call.hasProcessView) {
        emitSigned(_shared, "specific_to_pid", call.forProcess.pid());
    }
    emitCategoriesMember(_shared, categories);
    _shared.endObject();
}

void MWOutputFormatterJSON::printProcessAuxData(const MWAuxDataTree& auxData) {
    printGlobalAuxData(auxData);
    _json.endObject();
}

void MWOutputFormatterJSON::printProcessesWithWarnings(const std::vector<const MWProcess*>& processes,
                                                       const MWProcessErrors& errors) {
    _json.endArray();
    _json.key("errors");
    _json.beginArray();
    emitStrings(_json, errors.globalErrors);
    for (const MWProcess* process : errors.processesWithErrors) {
        emitStrings(_json, process->errors());
    }
    _json.endArray();
    _json.key("warnings");
    _json.beginArray();
    for (const MWProcess* process : processes) {
        emitStrings(_json, process->warnings());
    }
    _json.endArray();
}

void MWOutputFormatterJSON::printSummaryCategories(const MWCategoryTable& categories,
                                                   const MWSummaryCall& call) {
    _json.key("summary");
    _json.beginObject();
    emitCategories(_json, categories);
    _json.key("total");
    emitTotals(_json, call.total);
    _json.endObject();
    emitNumber(_json, "total memweight", call.total.dirty + call.total.swapped);
}

void MWOutputFormatterJSON::printGlobalAuxData(const MWAuxDataTree& auxData) {
    _json.key("auxiliary");
    emitAuxData(_json, auxData.get());
}

void MWOutputFormatterJSON::endAtTime(const MWTime& time) {
    _json.key("shared");
    _json.beginArray();
    if (!_shared.text().empty()) {
        _json.json(_shared.text());
    }
    _json.endArray();
    _emitTimeObjectForTime(time, "end_time");
    if (_multipleOutputs) {
        _json.endObject();
    }
}

void MWOutputFormatterJSON::close() {
    if (_multipleOutputs) {
        _json.endArray();
    }
    emitNumber(_json, "page size",
               _pageSize != 0 ? _pageSize : MWHostInterface::current().vm_kernel_page_size());
    _json.endObject();
    _json.flush();
    _file->close();
}
