#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "fuzz/FuzzTargets.h"

// What the fuzzer's own main calls. MEMWEIGHT_FUZZ_TARGET names the target of the run.

namespace {
const FuzzTarget* gTarget = nullptr;
}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***);
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

int LLVMFuzzerInitialize(int*, char***) {
    const char* name = std::getenv("MEMWEIGHT_FUZZ_TARGET");
    const auto targets = fuzzTargets();
    const auto found = std::ranges::find(targets, name == nullptr ? "" : name, &FuzzTarget::name);
    if (found == targets.end()) {
        std::fputs("MEMWEIGHT_FUZZ_TARGET names no target\n", stderr);
        std::exit(1);
    }
    gTarget = &*found;
    return 0;
}

int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    gTarget->read({reinterpret_cast<const char*>(data), size});
    return 0;
}
