#include "process/MWProcess.h"

#include <fmt/core.h>

#include "platform/MWHostInterface.h"
#include "platform/MWPhysMemweightSwitch.h"

std::string MWProcess::description() const {
    return fmt::format("MWProcess[{}]", _pid);
}

uint64_t MWProcess::_gatherPageSize() {
    return MWHostInterface::current().vm_kernel_page_size();
}

MWAuxDataTree MWProcess::auxData() const {
    return nullptr;
}

bool MWProcess::breakDownPhysMemweight() const {
    return MWPhysMemweightSwitch::isOn();
}

bool MWProcess::_initWithBsdInfo(const proc_bsdinfo& info) {
    _pid = static_cast<int32_t>(info.pbi_pid);
    _is64bit = (info.pbi_flags & PROC_FLAG_LP64) != 0;
    if (!_populateTask()) {
        return false;
    }
    _name = _nameForBsdInfo(info);
    _displayString = fmt::format("{} [{}]", _name, _pid);
    _pageSize = _gatherPageSize();
    return true;
}
