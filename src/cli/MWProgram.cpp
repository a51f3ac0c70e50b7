#include "cli/MWProgram.h"

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>

#include "platform/MWWorkQueue.h"

namespace {

// Much of what a process's gathering takes is free again when the next one begins. Given back to the kernel
// in between, it would have to be cleared each time. What only a process of very many mappings needs is given
// back, as the next thread's share of the memory is another one.
void keepFreedMemory() {
    constexpr int kMost = 32 << 20;
    constexpr int kLarge = 2 << 20;
    constexpr int kStep = 256 << 10;
    mallopt(M_TRIM_THRESHOLD, kMost);
    mallopt(M_MMAP_THRESHOLD, kLarge);
    mallopt(M_TOP_PAD, kStep);
}

}  // namespace

void MWPrepareProgram() {
    keepFreedMemory();
    // A file opened later must not take the place of a standard stream that the caller closed: what is told
    // would be written into it.
    int descriptor = 0;
    do {
        descriptor = open("/dev/null", O_RDWR);
    } while (descriptor >= 0 && descriptor <= STDERR_FILENO);
    close(descriptor);
    // A reader that has seen enough of the report must not cut the output files off.
    std::signal(SIGPIPE, SIG_IGN);
    // A file that may not grow any more is told like a full disk.
    std::signal(SIGXFSZ, SIG_IGN);
}

int MWEndProgram(int status) {
    if (MWConcurrentQueue::hasGivenUp()) {
        std::fflush(nullptr);
        _exit(status);
    }
    return status;
}
