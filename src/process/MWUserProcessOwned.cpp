#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/MWHostInterface.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "process/MWUserProcess.h"

namespace {

constexpr size_t kRoomForMoreEntries = 16 * sizeof(OwnedObjectRecord);
/// A reply that is still cut off after so many attempts is that of a host which fills any buffer.
constexpr int kAttempts = 64;

MWAuxDatum bytesOfOneProcess(uint64_t bytes) {
    return std::make_shared<const MWAuxData>(static_cast<int64_t>(bytes), false);
}

/// A reply that is shorter than it says, which no kernel gives, lists nothing.
MWOwnedObjects ownedObjectsOfReply(std::span<const std::byte> reply) {
    uint64_t count = 0;
    if (reply.size() < sizeof(count)) {
        return {};
    }
    std::memcpy(&count, reply.data(), sizeof(count));
    reply = reply.subspan(sizeof(count));
    if (count > reply.size() / sizeof(OwnedObjectRecord)) {
        return {};
    }
    MWOwnedObjects objects;
    for (; count != 0; --count) {
        OwnedObjectRecord record;
        std::memcpy(&record, reply.data(), sizeof(record));
        objects.insert_or_assign(record.object_id, record);
        reply = reply.subspan(sizeof(record));
    }
    return objects;
}

}  // namespace

void MWUserProcess::_gatherPhysMemweight() {
    rusage_info_v5 usage;
    if (_isAlive() && MWHostInterface::current().proc_pid_rusage(pid(), usage) == 0) {
        _physMemweight = usage.ri_phys_memweight;
        _phys_memweight_peak = usage.ri_lifetime_max_phys_memweight;
    }
}

MWAuxDataTree MWUserProcess::auxData() const {
    if (_physMemweight == 0) {
        return nullptr;
    }
    return std::make_shared<const MWAuxDataContainer>(
        MWAuxDataContainer::Elements{{"phys_memweight", bytesOfOneProcess(_physMemweight)},
                                     {"phys_memweight_peak", bytesOfOneProcess(_phys_memweight_peak)}});
}

void MWUserProcess::_gatherLedgers() {
    if (!breakDownPhysMemweight() || !_isAlive()) {
        return;
    }
    MWHostInterface& host = MWHostInterface::current();
    const MWLedgerTable& table = host.ledgerTable();
    if (table.pageTableIndex < 0) {
        return;
    }
    std::vector<ledger_entry_info> entries(static_cast<size_t>(table.entryCount));
    size_t filled = 0;
    if (host.ledgerEntries(pid(), entries, filled) < 0) {
        _addErrnoWarningWithDescription("Unable to retrieve ledger entry info");
        return;
    }
    const int64_t balance = entries[static_cast<size_t>(table.pageTableIndex)].lei_balance;
    _ledgers[0] = static_cast<uint64_t>(std::max<int64_t>(balance, 0));
}

bool MWUserProcess::_asksForOwnedVmObjects() const {
    return _task && !hiddenFromDisplay() && MWPhysMemweightSwitch::isOn();
}

// Also one that is gathered already: what it holds is not to be charged to another, and who shares memory
// with it is not alone.
void MWUserProcess::prepareToGatherData() {
    if (_task && _isAlive()) {
        MWHostInterface::current().surveyTask(*_task, _asksForOwnedVmObjects());
    }
}

/// The bytes of the reply. The kernel's list can grow between two questions, so the buffer has room for more
/// than there was, and a reply that fills it may have been cut off.
std::optional<std::vector<std::byte>> MWUserProcess::_fetchOwnedVmObjects() {
    MWHostInterface& host = MWHostInterface::current();
    size_t length = 0;
    if (host.sysctlOwnedVmObjects(*_task, {}, length) != 0) {
        if (errno != ENOENT) {
            _addErrnoWarningWithDescription("vm.get_owned_vmobjects");
        }
        return std::nullopt;
    }
    if (length == 0) {
        return std::vector<std::byte>();
    }
    std::vector<std::byte> reply(length);
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        reply.resize(reply.size() + kRoomForMoreEntries);
        length = reply.size();
        if (host.sysctlOwnedVmObjects(*_task, reply, length) != 0) {
            _addErrnoWarningWithDescription("vm.get_owned_vmobjects");
            return std::nullopt;
        }
        if (length < reply.size()) {
            reply.resize(length);
            return reply;
        }
    }
    errno = EOVERFLOW;
    _addErrnoWarningWithDescription("vm.get_owned_vmobjects");
    return std::nullopt;
}

std::optional<MWOwnedObjects> MWUserProcess::_gatherOwnedVmObjects() {
    if (!_asksForOwnedVmObjects()) {
        return std::nullopt;
    }
    const auto reply = _fetchOwnedVmObjects();
    return reply ? std::optional(ownedObjectsOfReply(*reply)) : std::nullopt;
}
