#include "cli/MWEntry.h"
#include "cli/MWProgram.h"
#include "platform/linux/MWLinuxHost.h"

int main(int argc, char* argv[]) {
    MWPrepareProgram();
    // Neither is ever destroyed, see MWKeptUntilExit.
    static auto& host = *new MWLinuxHost;
    static auto& kept = *new MWKeptUntilExit;
    MWHostInterface::setCurrent(&host);
    return MWEndProgram(MWMemweightMain(argc, argv, &kept));
}
