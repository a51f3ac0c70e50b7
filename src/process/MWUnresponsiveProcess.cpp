#include "process/MWUnresponsiveProcess.h"

#include <fmt/core.h>

MWUnresponsiveProcess::MWUnresponsiveProcess(const MWProcess& stuck) {
    setPid(stuck.pid());
    setIs64bit(stuck.is64bit());
    setIsTranslated(stuck.isTranslated());
    setHiddenFromDisplay(stuck.hiddenFromDisplay());
    setName(stuck.name());
    setDisplayString(stuck.displayString());
    setPageSize(stuck.pageSize());
    _addNotResponding();
}

MWUnresponsiveProcess::MWUnresponsiveProcess(const proc_bsdinfo& stuck) {
    setPid(static_cast<int32_t>(stuck.pbi_pid));
    setIs64bit((stuck.pbi_flags & PROC_FLAG_LP64) != 0);
    setName(_nameForBsdInfoCommName(stuck));
    setDisplayString(fmt::format("{} [{}]", name(), pid()));
    setPageSize(_gatherPageSize());
    _addNotResponding();
}

void MWUnresponsiveProcess::_addNotResponding() {
    _addError(fmt::format("{}: not responding", displayString()));
}
