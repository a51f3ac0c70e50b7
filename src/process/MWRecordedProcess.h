#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "platform/HeapsnapReader.h"
#include "process/MWUserProcess.h"

/// A live process on its way into a heapsnap: walked as for measuring, each region passed on as it was met.
class MWRecordedProcess : public MWUserProcess {
public:
    /// None unless the process exists and can be read; the reason may then be on standard error.
    static std::shared_ptr<MWRecordedProcess> processWithPid(int32_t pid);

    /// What the snapshot says of the process as such.
    HeapsnapProcess identity() const;
    /// Passes the regions on in ascending order. What keeps them from being the whole is filed as the
    /// process's errors.
    void record(const std::function<void(const HeapsnapRegion&)>& take);

protected:
    /// Also of a process that has ended: what was saved of it is not the whole.
    void _processMachVMError(kern_return_t result, MWExpectedError expected) override;

private:
    MWRecordedProcess() = default;
    HeapsnapRegion _regionOf(MWImageEnumerator& images, const MWWalkedRegion& walked) const;
};
