#include "cli/MWProgram.h"

#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>

#include "platform/MWHeap.h"
#include "platform/MWWorkQueue.h"

void MWPrepareProgram() {
    MWPrepareHeap();
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
