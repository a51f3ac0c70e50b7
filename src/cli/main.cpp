#include "cli/MWEntry.h"
#include "cli/MWProgram.h"
#include "platform/linux/MWLinuxHost.h"

int main(int argc, char* argv[]) {
    MWPrepareProgram();
    MWLinuxHost host;
    MWHostInterface::setCurrent(&host);
    return MWMemweightMain(argc, argv);
}
