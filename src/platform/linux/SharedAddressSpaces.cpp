#include "platform/linux/SharedAddressSpaces.h"

#include <linux/kcmp.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>

namespace {

// 0: one address space; 1 and 2: below and above in an order of the kernel's own; 3 or negative: cannot say.
long compareSpaces(int32_t thread, int32_t otherThread) {
    return syscall(SYS_kcmp, thread, otherThread, KCMP_VM, 0, 0);
}

}  // namespace

// Where the space of `thread` stands among the members, or none when the kernel does not compare. Members
// that have ended since are forgotten.
std::optional<size_t> SharedAddressSpaces::_place(Members& members, int32_t thread) {
    size_t first = 0;
    size_t last = members.size();
    while (first != last) {
        const size_t middle = first + (last - first) / 2;
        const long order = compareSpaces(members[middle].thread, thread);
        if (order < 0) {
            if (errno != ESRCH || compareSpaces(thread, thread) < 0) {
                return std::nullopt;
            }
            members.erase(members.begin() + static_cast<ptrdiff_t>(middle));
            first = 0;
            last = members.size();
        } else if (order == 1) {
            first = middle + 1;
        } else {
            last = middle;
        }
    }
    return first;
}

ProcessIdentity SharedAddressSpaces::ownerOf(const Candidate& candidate) {
    const std::lock_guard lock(_mutex);
    Members& members = _members[candidate.startStack];
    if (members.size() == 1 && members.front().process == candidate.process) {
        return candidate.process;
    }
    const auto place = _place(members, candidate.thread);
    if (!place) {
        return candidate.process;
    }
    if (*place < members.size() && compareSpaces(members[*place].thread, candidate.thread) == 0) {
        return members[*place].process;
    }
    members.insert(members.begin() + static_cast<ptrdiff_t>(*place), {candidate.process, candidate.thread});
    _startStacks.emplace(candidate.process.pid, candidate.startStack);
    return candidate.process;
}

void SharedAddressSpaces::forget(const ProcessIdentity& process) {
    const std::lock_guard lock(_mutex);
    const auto [first, last] = _startStacks.equal_range(process.pid);
    for (auto place = first; place != last; ++place) {
        const auto entry = _members.find(place->second);
        if (entry != _members.end()) {
            std::erase_if(entry->second, [&](const Member& member) { return member.process == process; });
            if (entry->second.empty()) {
                _members.erase(entry);
            }
        }
    }
    _startStacks.erase(process.pid);
}
