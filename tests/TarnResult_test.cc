// The result type and the exception fence: what a caller relies on when it
// passes errors up with TARN_TRY or reads a code off at the wire.
#include "Daemon/TarnResult.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnGlobalConfiguration.h"

namespace tarn {
namespace {

TarnResult<int> parsePositive(int n) {
    if (n <= 0) return TARN_ERROR_CODE(TarnErrorBadInput, nullptr);
    return n;
}

TarnResult<std::string> describePositive(int n, std::vector<int>* seen) {
    int value = TARN_TRY(parsePositive(n));
    seen->push_back(value);  // never reached after a failure
    return std::to_string(value);
}

TarnStatus checkBoth(int a, int b) {
    TARN_TRY(parsePositive(a));
    TARN_TRY(parsePositive(b));
    return {};
}

TEST(TarnResultTest, TryPassesTheFirstErrorUpUnchangedAndStopsThere) {
    std::vector<int> seen;
    auto good = describePositive(7, &seen);
    ASSERT_TRUE(good.ok());
    EXPECT_EQ(*good, "7");

    auto bad = describePositive(-1, &seen);
    ASSERT_FALSE(bad.ok());
    EXPECT_EQ(bad.code(TarnErrorInvalidArgument), uint64_t{TarnErrorBadInput});
    EXPECT_EQ(bad.error()->functionName(), "parsePositive");
    EXPECT_EQ(seen, std::vector<int>{7});

    EXPECT_TRUE(checkBoth(1, 2).ok());
    EXPECT_EQ(checkBoth(1, 0).code(TarnErrorInvalidArgument), uint64_t{TarnErrorBadInput});
}

TEST(TarnResultTest, AFailureNeverReadsAsSuccessAtTheWire) {
    // Without an error value, and with a foreign (POSIX) one, the fallback answers.
    TarnResult<int> noValue{TarnErrorRef()};
    EXPECT_FALSE(noValue.ok());
    EXPECT_EQ(noValue.code(TarnErrorNotFound), uint64_t{TarnErrorNotFound});
    TarnStatus posix{TARN_POSIX_ERROR(ENOENT, "gone")};
    EXPECT_EQ(posix.code(TarnErrorDeleteFailed), uint64_t{TarnErrorDeleteFailed});

    uint64_t slot = TarnSuccess;
    EXPECT_TRUE(TarnReport(TarnResult<int>(3), &slot, TarnErrorBadInput));
    EXPECT_EQ(slot, uint64_t{TarnSuccess});
    EXPECT_FALSE(TarnReport(noValue, &slot, TarnErrorBadInput));
    EXPECT_EQ(slot, uint64_t{TarnErrorBadInput});
}

TEST(TarnResultTest, TheFenceTurnsAnExceptionIntoErrorFortyOnCustomerBuilds) {
    TarnGlobalConfiguration::sharedInstance().setIsInternalImage(false);
    auto thrown = TarnFenceExceptions(
        "fenceTest", []() -> TarnResult<int> { throw std::out_of_range("index 9"); });
    ASSERT_FALSE(thrown.ok());
    EXPECT_EQ(thrown.code(TarnErrorInvalidArgument), uint64_t{TarnErrorException});
    EXPECT_EQ(thrown.error()->functionName(), "fenceTest");
    ASSERT_TRUE(thrown.error()->localizedDescription());
    EXPECT_NE(thrown.error()->localizedDescription()->find("index 9"), std::string::npos);

    // A body that returns nothing or a plain value is fenced the same way.
    EXPECT_TRUE(TarnFenceExceptions("fenceTest", [] {}).ok());
    EXPECT_EQ(*TarnFenceExceptions("fenceTest", [] { return 5; }), 5);
    EXPECT_EQ(TarnFenceExceptions("fenceTest", [] { throw 3; }).code(TarnSuccess),
              uint64_t{TarnErrorException});
}

TEST(TarnResultDeathTest, TheFenceEndsAnInternalBuildWithTheFatalReport) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            TarnGlobalConfiguration::sharedInstance().setIsInternalImage(true);
            (void)TarnFenceExceptions("fenceTest", [] { throw std::runtime_error("boom"); });
        },
        "INTERNAL ERROR: Uncaught Exception");
    TarnGlobalConfiguration::sharedInstance().setIsInternalImage(false);
}

}  // namespace
}  // namespace tarn
