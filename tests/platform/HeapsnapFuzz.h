#pragma once

#include <cstddef>
#include <cstdint>

/// What a fuzzer calls, under the name by which it finds it: reads any bytes as a heapsnap and ends the
/// program where the reader does not keep what it promises.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);
