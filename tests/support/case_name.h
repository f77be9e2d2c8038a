#pragma once

#include <gtest/gtest.h>

#include <string>

namespace test {

// Names parameterized tests by the member `name` of their parameters.
struct CaseName {
    template <typename Parameter>
    std::string operator()(const ::testing::TestParamInfo<Parameter>& info) const {
        return info.param.name;
    }
};

}  // namespace test
