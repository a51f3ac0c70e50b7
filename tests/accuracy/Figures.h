#pragma once

#include <cstdint>
#include <string>

/// Whether the scenarios have their full sizes and their figures are printed; otherwise they are a quarter
/// as large. (MEMWEIGHT_ACCURACY=full in the environment.)
bool isFullRun();
/// So many MiB in a full run, a quarter otherwise; and as bytes.
uint64_t scaled(uint64_t mebibytes);
uint64_t scaledBytes(uint64_t mebibytes);

struct Figure {
    std::string scenario;
    uint64_t measured;
    uint64_t truth;
};

/// Fails the test when the figure is further from the truth than `percent` of the truth.
void expectNear(const Figure& figure, double percent = 0.5);
