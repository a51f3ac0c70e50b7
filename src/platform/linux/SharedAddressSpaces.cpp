#include "platform/linux/SharedAddressSpaces.h"

#include <linux/kcmp.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace {

// 0: one address space; 1 and 2: below and above in an order of the kernel's own; 3 or negative: cannot say.
long compareSpaces(int32_t thread, int32_t otherThread) {
    return syscall(SYS_kcmp, thread, otherThread, KCMP_VM, 0, 0);
}

}  // namespace

// Where the space of `thread` stands among the members; those that have ended since cannot be compared with
// and are forgotten.
SharedAddressSpaces::Members::iterator SharedAddressSpaces::_place(Members& members, int32_t thread) {
    auto first = members.begin();
    auto last = members.end();
    while (first != last) {
        const auto middle = first + (last - first) / 2;
        const long order = compareSpaces(middle->thread, thread);
        if (order < 0) {
            members.erase(middle);
            first = members.begin();
            last = members.end();
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
    const auto place = _place(members, candidate.thread);
    if (place != members.end() && compareSpaces(place->thread, candidate.thread) == 0) {
        return place->process;
    }
    members.insert(place, {candidate.process, candidate.thread});
    return candidate.process;
}
