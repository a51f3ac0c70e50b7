#pragma once

#include <cstdint>

// Sums of figures that come from outside. A record that claims more than 2^64 bytes is wrong in any case;
// stopping at the ends keeps it from turning into a small and plausible figure.

constexpr uint64_t MWSaturatingAdd(uint64_t a, uint64_t b) {
    return a > UINT64_MAX - b ? UINT64_MAX : a + b;
}
constexpr uint64_t MWSaturatingSubtract(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
}
constexpr uint64_t MWSaturatingMultiply(uint64_t a, uint64_t b) {
    return b != 0 && a > UINT64_MAX / b ? UINT64_MAX : a * b;
}

/// Down to a multiple of `pageSize`.
constexpr uint64_t MWPageFloor(uint64_t address, uint64_t pageSize) {
    return address - address % pageSize;
}
