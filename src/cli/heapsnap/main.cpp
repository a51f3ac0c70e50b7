#include "cli/MWHeapsnapEntry.h"
#include "cli/MWProgram.h"
#include "platform/linux/MWLinuxHost.h"

int main(int argc, char* argv[]) {
    MWPrepareProgram();
    static auto& host = *new MWLinuxHost("/proc", "/sys", MappingSource::smaps);
    MWHostInterface::setCurrent(&host);
    return MWEndProgram(MWHeapsnapMain(argc, argv));
}
