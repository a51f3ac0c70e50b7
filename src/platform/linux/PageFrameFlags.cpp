#include "platform/linux/PageFrameFlags.h"

#include <unistd.h>

uint64_t PageFrameFlags::flagsOfFrame(uint64_t frame) const {
    uint64_t flags = 0;
    const auto offset = static_cast<off_t>(frame * sizeof(flags));
    return ::pread(_file.get(), &flags, sizeof(flags), offset) == sizeof(flags) ? flags : 0;
}
