#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "support/sandbox_check.h"

int main(int argc, char** argv) {
    ::testing::InitGoogleMock(&argc, argv);
    if (!GTEST_FLAG_GET(list_tests)) {
        test::requireSandbox();
    }
    return RUN_ALL_TESTS();
}
