#include "platform/linux/ForkFamily.h"

#include <sys/uio.h>

#include <elf.h>
#include <array>
#include <bit>
#include <cstring>
#include <numeric>
#include <set>
#include <string>

#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace {

template <class Word>
std::optional<uint64_t> findAuxiliaryValue(std::string_view auxv, Word type) {
    std::array<Word, 2> entry = {};
    for (; auxv.size() >= sizeof(entry); auxv.remove_prefix(sizeof(entry))) {
        std::memcpy(entry.data(), auxv.data(), sizeof(entry));
        if (entry[0] == type) {
            return entry[1];
        }
    }
    return std::nullopt;
}

using RandomBytes = std::array<char, 16>;

std::optional<RandomBytes> readRandomBytes(int32_t pid, std::string_view auxv) {
    const std::optional<uint64_t> address = randomBytesAddress(auxv);
    if (!address) {
        return std::nullopt;
    }
    RandomBytes bytes = {};
    const iovec local = {bytes.data(), bytes.size()};
    // NOLINTNEXTLINE(performance-no-int-to-ptr): an address of the other process, not of this one
    const iovec remote = {reinterpret_cast<void*>(*address), bytes.size()};
    const bool read = process_vm_readv(pid, &local, 1, &remote, 1, 0) == static_cast<ssize_t>(bytes.size());
    return read ? std::optional(bytes) : std::nullopt;
}

// The random bytes lie on the stack, which without address randomisation ends at the end of the address
// space.
bool hasRandomAddresses(uint64_t stackAddress) {
    constexpr uint64_t kLargestArguments = 16U << 20U;
    return !std::has_single_bit((stackAddress | (kLargestArguments - 1)) + 1);
}

// The oldest process of the chain of parents, beginning with `first`, that runs the same executable. Pids
// that are given away while the chain is followed can lead back into it.
uint64_t oldestOfChain(int procDirectory, int32_t first, const ObjectIdentity& identity) {
    std::string executable;
    std::string text;
    procfs::ProcStat oldest;
    std::set<int32_t> met;
    for (int32_t pid = first; pid != 0 && met.insert(pid).second; pid = oldest.ppid) {
        const std::string directory = std::to_string(pid);
        const bool known = procfs::readLink(procDirectory, (directory + "/exe").c_str(), text);
        if (pid == first) {
            executable = known ? text : "";
        } else if (!known || text != executable) {
            break;
        }
        procfs::readFile(procDirectory, (directory + "/stat").c_str(), text);
        const auto stat = procfs::parseStat(text);
        if (!stat) {
            break;
        }
        oldest = *stat;
    }
    return identity.process(oldest.pid, oldest.startTime, 0);
}

}  // namespace

std::optional<uint64_t> randomBytesAddress(std::string_view auxv) {
    const std::optional<bool> is64bit = procfs::auxvIs64bit(auxv);
    if (!is64bit) {
        return std::nullopt;
    }
    return *is64bit ? findAuxiliaryValue<uint64_t>(auxv, AT_RANDOM)
                    : findAuxiliaryValue<uint32_t>(auxv, AT_RANDOM);
}

std::optional<uint64_t> randomBytesIdentifier(std::string_view auxv, int32_t pid,
                                              const ObjectIdentity& identity) {
    const auto bytes = readRandomBytes(pid, auxv);
    return bytes ? std::optional(identity.bytes({bytes->data(), bytes->size()})) : std::nullopt;
}

uint64_t forkFamilyIdentifier(int procDirectory, int processDirectory, int32_t pid,
                              const ObjectIdentity& identity) {
    std::string auxv;
    procfs::readRecord(processDirectory, "auxv", auxv);
    if (const auto identifier = randomBytesIdentifier(auxv, pid, identity)) {
        return *identifier;
    }
    const std::optional<uint64_t> stackAddress = randomBytesAddress(auxv);
    if (stackAddress && hasRandomAddresses(*stackAddress)) {
        return identity.bytes(auxv);
    }
    return oldestOfChain(procDirectory, pid, identity);
}

std::shared_ptr<ForkFamily> ForkFamilies::family(uint64_t identifier) {
    const std::lock_guard lock(_mutex);
    std::erase_if(_families, [](const auto& entry) { return entry.second.expired(); });
    std::weak_ptr<ForkFamily>& known = _families[identifier];
    std::shared_ptr<ForkFamily> family = known.lock();
    if (family == nullptr) {
        family = std::make_shared<ForkFamily>(identifier);
        known = family;
    }
    return family;
}

void ForkFamily::setPart(int32_t pid, uint64_t bytes) {
    const std::lock_guard lock(_mutex);
    _parts[pid] = bytes;
}

uint64_t ForkFamily::sumOfParts() const {
    const std::lock_guard lock(_mutex);
    return std::accumulate(_parts.begin(), _parts.end(), uint64_t{0},
                           [](uint64_t sum, const auto& part) { return sum + part.second; });
}
