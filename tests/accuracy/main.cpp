#include <gtest/gtest.h>

#include "accuracy/Figures.h"

int main(int argc, char* argv[]) {
    testing::InitGoogleTest(&argc, argv);
    const int result = RUN_ALL_TESTS();
    if (isFullRun()) {
        printFigures();
    }
    return result;
}
