#include "platform/MWHostInterface.h"

#include <chrono>
#include <utility>

#include "platform/MWInvariant.h"

namespace {
// Set on the main thread before any other thread exists, read from all of them.
MWHostInterface* gCurrentHost = nullptr;
}  // namespace

MWHostInterface& MWHostInterface::current() {
    MW_INVARIANT(gCurrentHost != nullptr, "no host is installed");
    return *gCurrentHost;
}

MWHostInterface* MWHostInterface::setCurrent(MWHostInterface* host) {
    return std::exchange(gCurrentHost, host);
}

void MWHostInterface::waitForChange(std::unique_lock<std::mutex>& lock, std::condition_variable& changed,
                                    uint64_t nanoseconds) {
    changed.wait_for(lock, std::chrono::nanoseconds(nanoseconds));
}

const MWLedgerTable& MWHostInterface::ledgerTable() {
    std::call_once(_ledgerTableRead, [this] { _ledgerTable = MWReadLedgerTable(*this); });
    return _ledgerTable;
}
