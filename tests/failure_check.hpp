// The check every failure test makes: the call failed (false or null) and the error trace
// starts with the expected code.
#ifndef PLANO_TESTS_FAILURE_CHECK_HPP
#define PLANO_TESTS_FAILURE_CHECK_HPP

#include <gtest/gtest.h>

#include <cstdint>
#include <memory>

#include "pellux/error.h"

namespace plano_test {

inline ::testing::AssertionResult fails_with(bool ok, int32_t code)
{
    Plx_ErrorRecord record{};
    const int32_t got = plx_err_get_error(0, &record) ? record.code : 0;
    if (ok) return ::testing::AssertionFailure() << "the call succeeded";
    if (got != code) return ::testing::AssertionFailure() << "failed with code " << got << ", not " << code;
    return ::testing::AssertionSuccess();
}
inline ::testing::AssertionResult fails_with(const void *result, int32_t code)
{
    return fails_with(result != nullptr, code);
}
template <class T, class D>
::testing::AssertionResult fails_with(const std::unique_ptr<T, D> &result, int32_t code)
{
    return fails_with(result.get(), code);
}

}  // namespace plano_test

#endif
