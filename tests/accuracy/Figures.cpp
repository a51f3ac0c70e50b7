#include "accuracy/Figures.h"

#include <fmt/core.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <string_view>

bool isFullRun() {
    const char* wanted = std::getenv("MEMWEIGHT_ACCURACY");
    return wanted != nullptr && std::string_view(wanted) == "full";
}

uint64_t scaled(uint64_t mebibytes) {
    return isFullRun() ? mebibytes : mebibytes / 4;
}

uint64_t scaledBytes(uint64_t mebibytes) {
    return scaled(mebibytes) << 20U;
}

void expectNear(const Figure& figure, double percent) {
    ASSERT_NE(figure.truth, 0U) << figure.scenario;
    const double mebibyte = 1U << 20U;
    const auto measured = static_cast<double>(figure.measured);
    const auto truth = static_cast<double>(figure.truth);
    const double off = 100 * (measured - truth) / truth;
    const std::string text =
        fmt::format("{:<58} measured {:>10.2f} MiB, truth {:>10.2f} MiB, off by {:+.3f} %", figure.scenario,
                    measured / mebibyte, truth / mebibyte, off);
    EXPECT_LE(std::abs(off), percent) << text;
    if (isFullRun()) {
        fmt::print("{}\n", text);
    }
}
