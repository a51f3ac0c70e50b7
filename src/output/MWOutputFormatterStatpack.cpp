#include "output/MWOutputFormatterStatpack.h"

#include <cstdio>

#include "platform/MWPhysMemweightSwitch.h"
#include "process/MWProcess.h"

namespace {

constexpr const char* kAllProcesses = "ALL_PROCESSES";
const std::string kAuxData = "aux_data";

uint64_t bytesOf(const MWMemoryCategory& category) {
    return category.totalDirtySize() + category.totalSwappedSize();
}

}  // namespace

std::unique_ptr<MWOutputFormatterStatpack> MWOutputFormatterStatpack::initWithPath(const std::string& path) {
    const bool breaksDown = MWPhysMemweightSwitch::isOn();
    auto writer =
        spwriter_open(path, breaksDown ? "memweight.phys_memweight" : "memweight.vm_object_dirty", 1, 0);
    if (writer == nullptr) {
        std::perror("Unable to open spwriter");
        return nullptr;
    }
    spwriter_set_description(*writer, "Memory measurements gathered by the memweight(1) tool");
    spwriter_set_primary_metric(*writer, "total_memory,process=ALL_PROCESSES");
    return std::unique_ptr<MWOutputFormatterStatpack>(new MWOutputFormatterStatpack(std::move(writer)));
}

void MWOutputFormatterStatpack::_recordBytes(std::string_view metric, double bytes,
                                             std::string_view process) {
    spwriter_new_value(*_writer, metric, spunit_B, bytes);
    spwriter_record_variable_str(*_writer, "process", process);
}

void MWOutputFormatterStatpack::printProcessHeader(const MWProcess& process) {
    spwriter_new_group(*_writer);
    _currentProcess = &process;
}

void MWOutputFormatterStatpack::printProcessTotal(uint64_t memweight, const MWProcess& forProcess) {
    _recordBytes("total_memory", static_cast<double>(memweight), forProcess.name());
    spwriter_record_label_str(*_writer, "pid", std::to_string(forProcess.pid()));
    spwriter_record_tag(*_writer, sptag_summary);
}

void MWOutputFormatterStatpack::printProcessCategories(const MWCategoryTable& categories,
                                                       const MWCategoryTotals&) {
    _currentProcessTotals.emplace();
    _addCategories(categories);
}

void MWOutputFormatterStatpack::printSharedCategories(const MWCategoryTable& categories,
                                                      const MWSharedCategoriesCall&) {
    _addCategories(categories);
}

void MWOutputFormatterStatpack::_addCategories(const MWCategoryTable& categories) {
    if (!_currentProcessTotals) {
        return;
    }
    for (const auto& [name, category] : categories) {
        (*_currentProcessTotals)[category.fullName()] += bytesOf(category);
    }
}

void MWOutputFormatterStatpack::printProcessAuxData(const MWAuxDataTree& auxData) {
    if (_currentProcessTotals) {
        for (const auto& [name, bytes] : *_currentProcessTotals) {
            _recordBytes(name, static_cast<double>(bytes), _currentProcess->name());
        }
        _currentProcessTotals.reset();
    }
    _emitAuxData(auxData.get(), {.parentMetric = kAuxData, .processName = _currentProcess->name()});
}

void MWOutputFormatterStatpack::_emitAuxData(const MWAuxDataType* value, const AuxDataMetric& metric) {
    constexpr size_t kLongestName = 1023;
    if (value != nullptr && value->isContainer()) {
        for (const auto& [key, element] : static_cast<const MWAuxDataContainer&>(*value).elements()) {
            const std::string child = (metric.parentMetric + "." + key).substr(0, kLongestName);
            _emitAuxData(element.get(), {.parentMetric = child, .processName = metric.processName});
        }
        return;
    }
    const int64_t bytes = value == nullptr ? 0 : static_cast<const MWAuxData&>(*value).value();
    _recordBytes(metric.parentMetric, static_cast<double>(bytes), metric.processName);
    spwriter_record_tag(*_writer, sptag_context);
}

void MWOutputFormatterStatpack::printSummaryCategories(const MWCategoryTable& categories,
                                                       const MWSummaryCall& call) {
    spwriter_new_group(*_writer);
    _recordBytes("total_memory", static_cast<double>(call.total.dirty + call.total.swapped), kAllProcesses);
    spwriter_record_tag(*_writer, sptag_summary);
    for (const auto& [name, category] : categories) {
        _recordBytes(category.fullName(), static_cast<double>(bytesOf(category)), kAllProcesses);
    }
}

void MWOutputFormatterStatpack::printGlobalAuxData(const MWAuxDataTree& auxData) {
    _emitAuxData(auxData.get(), {.parentMetric = kAuxData, .processName = kAllProcesses});
}

void MWOutputFormatterStatpack::endAtTime(const MWTime& time) {
    constexpr uint64_t kPerMillisecond = 1'000'000;
    const uint64_t elapsed = time.machContinuousTimeNsec() - _startTime->machContinuousTimeNsec();
    const uint64_t milliseconds = elapsed / kPerMillisecond;
    spwriter_new_value(*_writer, "gather_duration", spunit_ms, static_cast<double>(milliseconds));
    spwriter_record_tag(*_writer, sptag_context);
    spwriter_flush(*_writer);
}

void MWOutputFormatterStatpack::close() {
    spwriter_close(std::move(_writer));
}
