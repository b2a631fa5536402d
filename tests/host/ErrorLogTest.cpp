#include "host/ErrorLog.h"

#include <gtest/gtest.h>

#include "platform/foundation/Log.h"

namespace cindral::test {
namespace {

constexpr KsDate kNow{1'000'000, 5};

TEST(ErrorLog, countsTheErrorsOfAnHour) {
    ErrorLog errors;
    errors.add({1'000'000 - 3'600, 5}, "[ERROR] too old");
    errors.add({1'000'000 - 3'600, 6}, "[ERROR] just in");
    errors.add({999'999, 0}, "the last");
    EXPECT_EQ(errors.recent(kNow).count, 2U);
    EXPECT_EQ(errors.recent(kNow).last, "the last");
    EXPECT_EQ(errors.recent({1'000'000 + 7'200, 0}).count, 0U);
    EXPECT_EQ(errors.recent({1'000'000 + 7'200, 0}).last, "");
}

TEST(ErrorLog, observesTheLog) {
    ErrorLog errors;
    logInfo("not this");
    logError("this {}", 1);
    const ErrorLog::Recent recent = errors.recent(KsDate::now());
    EXPECT_EQ(recent.count, 1U);
    EXPECT_EQ(recent.last, "this 1");
}

TEST(ErrorLog, countsNothingThatOnlySaysThatNothingIsThere) {
    ErrorLog errors;
    errors.add(kNow, "[ERROR] item lookup failed for identifier \"did=9\"");
    errors.add(kNow, "invalid identifier; identifier should have 2 components, not 1");
    EXPECT_EQ(errors.recent(kNow).count, 0U);
    EXPECT_EQ(errors.recent(kNow).last, "");
}

TEST(ErrorLog, forgets) {
    ErrorLog errors;
    errors.add(kNow, "a");
    errors.forget();
    EXPECT_EQ(errors.recent(kNow).count, 0U);
    errors.add(kNow, "b");
    EXPECT_EQ(errors.recent(kNow).last, "b");
}

TEST(ErrorLog, costsNoMoreMemoryThanItCounts) {
    ErrorLog errors;
    for (std::size_t i = 0; i < ErrorLog::kCountedMax + 10; ++i) errors.add(kNow, "again");
    EXPECT_EQ(errors.recent(kNow).count, ErrorLog::kCountedMax);
}

}  // namespace
}  // namespace cindral::test
