#pragma once

#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <string>

/// What lies beside the tests as recorded/`name`.
inline std::string recordedFile(const std::string& name) {
    std::ifstream file(MEMWEIGHT_RECORDED "/" + name);
    EXPECT_TRUE(file.is_open()) << name;
    return {std::istreambuf_iterator<char>(file), {}};
}
