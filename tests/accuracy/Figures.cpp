#include "accuracy/Figures.h"

#include <fmt/core.h>
#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <string_view>
#include <vector>

namespace {

constexpr uint64_t kMiB = 1U << 20U;

std::vector<Figure> figures;
std::vector<std::string> remarks;

double toMiB(uint64_t bytes) {
    return static_cast<double>(bytes) / static_cast<double>(kMiB);
}

double differencePercent(const Figure& figure) {
    const double difference = static_cast<double>(figure.measured) - static_cast<double>(figure.truth);
    return 100 * difference / static_cast<double>(figure.truth);
}

}  // namespace

bool isFullRun() {
    const char* wanted = std::getenv("MEMWEIGHT_ACCURACY");
    return wanted != nullptr && std::string_view(wanted) == "full";
}

std::string scaled(uint64_t mebibytes) {
    return std::to_string(isFullRun() ? mebibytes : mebibytes / 4);
}

uint64_t scaledBytes(uint64_t mebibytes) {
    return std::stoull(scaled(mebibytes)) * kMiB;
}

void expectNear(const Figure& figure, double percent) {
    figures.push_back(figure);
    ASSERT_NE(figure.truth, 0U) << figure.scenario;
    EXPECT_LE(std::abs(differencePercent(figure)), percent)
        << figure.scenario << ": measured " << toMiB(figure.measured) << " MiB, truth " << toMiB(figure.truth)
        << " MiB";
}

void addRemark(const std::string& remark) {
    remarks.push_back(remark);
}

void printFigures() {
    fmt::print("\n{:<58} {:>12} {:>12} {:>9}\n", "scenario", "measured MiB", "truth MiB", "off by %");
    for (const Figure& figure : figures) {
        fmt::print("{:<58} {:>12.2f} {:>12.2f} {:>+9.3f}\n", figure.scenario, toMiB(figure.measured),
                   toMiB(figure.truth), differencePercent(figure));
    }
    for (const std::string& remark : remarks) {
        fmt::print("{}\n", remark);
    }
}
