#include "cli/MWHeapsnapEntry.h"
#include "cli/MWProgram.h"
#include "platform/linux/MWLinuxHost.h"

int main(int argc, char* argv[]) {
    MWPrepareProgram();
    MWLinuxHost host("/proc", "/sys", MappingSource::smaps);
    MWHostInterface::setCurrent(&host);
    return MWHeapsnapMain(argc, argv);
}
