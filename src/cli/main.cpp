#include <fcntl.h>
#include <unistd.h>

#include <csignal>

#include "cli/MWEntry.h"
#include "platform/linux/MWLinuxHost.h"

namespace {

// A file opened later must not take the place of a standard stream that the caller closed: the report would
// be written into it.
void fillStandardDescriptors() {
    int descriptor = 0;
    do {
        descriptor = open("/dev/null", O_RDWR);
    } while (descriptor >= 0 && descriptor <= STDERR_FILENO);
    close(descriptor);
}

}  // namespace

int main(int argc, char* argv[]) {
    fillStandardDescriptors();
    // A reader that has seen enough of the report must not cut the output files off.
    std::signal(SIGPIPE, SIG_IGN);
    MWLinuxHost host;
    MWHostInterface::setCurrent(&host);
    return MWMemweightMain(argc, argv);
}
