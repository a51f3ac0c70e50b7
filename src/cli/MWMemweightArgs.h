#pragma once

#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <tl/expected.hpp>

#include "output/MWOutputFormatterText.h"
#include "platform/MWError.h"
#include "process/MWProcess.h"

/// What target resolution found. A map can come with an error beside it: names that matched nothing.
struct MWTargetResolution {
    std::optional<MWTargetMap> targets;
    std::optional<MWError> error;
};

/// The parsed command line. (Every field is a property with a getter and a setter.)
class MWMemweightArgs {
public:
    static tl::expected<MWMemweightArgs, MWError> initWithArgc(int argc, char* const argv[]);
    MWTargetResolution targetProcesses();
};
