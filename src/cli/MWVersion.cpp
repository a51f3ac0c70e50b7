#include "cli/MWVersion.h"

#include <fmt/printf.h>

#include <cstdio>

void MWPrintVersion(const char* program) {
    fmt::fprintf(stdout, "%s %s\n", program, MEMWEIGHT_VERSION);
}
