#pragma once

#include "process/MWProcess.h"

/// Stands for a process about which the system does not answer: it has an error and no data.
class MWUnresponsiveProcess : public MWProcess {
public:
    /// Reads nothing of `stuck` but what it got when it was made.
    explicit MWUnresponsiveProcess(const MWProcess& stuck);
    explicit MWUnresponsiveProcess(const proc_bsdinfo& stuck);

private:
    void _addNotResponding();
};
