#include "cli/MWEntry.h"
#include "platform/linux/MWLinuxHost.h"

int main(int argc, char* argv[]) {
    MWLinuxHost host;
    MWHostInterface::setCurrent(&host);
    return MWMemweightMain(argc, argv);
}
