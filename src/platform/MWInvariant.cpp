#include "platform/MWInvariant.h"

#include <cstdio>
#include <cstdlib>

void MWInvariantViolated(const char* text) {
    std::fprintf(stderr, "%s\n", text);
    std::abort();
}
