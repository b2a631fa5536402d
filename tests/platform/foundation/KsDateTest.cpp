#include "platform/foundation/KsDate.h"

#include <gtest/gtest.h>

#include <limits>
#include <random>

namespace cindral {
namespace {

constexpr std::int64_t kYear0 = -62'167'219'200;
constexpr std::int64_t kYear10000 = 253'402'300'800;

/// What the C library makes of whole seconds.
std::string textOfCLibrary(std::int64_t seconds) {
    const std::time_t time = seconds;
    std::tm parts{};
    ::gmtime_r(&time, &parts);
    char text[64];
    std::snprintf(text, sizeof text, "%04d-%02d-%02dT%02d:%02d:%02dZ", parts.tm_year + 1900, parts.tm_mon + 1,
                  parts.tm_mday, parts.tm_hour, parts.tm_min, parts.tm_sec);
    return text;
}

TEST(KsDate, writesWholeSecondsWithoutAFraction) {
    EXPECT_EQ(KsDate{}.rfc3339(), "1970-01-01T00:00:00Z");
    EXPECT_EQ((KsDate{.seconds = 1'795'168'320}).rfc3339(), "2026-11-20T09:52:00Z");
    EXPECT_EQ((KsDate{.seconds = -1}).rfc3339(), "1969-12-31T23:59:59Z");
}

TEST(KsDate, writesAFractionWithoutTrailingZeros) {
    EXPECT_EQ((KsDate{.seconds = 0, .nanoseconds = 1}).rfc3339(), "1970-01-01T00:00:00.000000001Z");
    EXPECT_EQ((KsDate{.seconds = 0, .nanoseconds = 500'000'000}).rfc3339(), "1970-01-01T00:00:00.5Z");
    EXPECT_EQ((KsDate{.seconds = 0, .nanoseconds = 120'300}).rfc3339(), "1970-01-01T00:00:00.0001203Z");
    EXPECT_EQ((KsDate{.seconds = -1, .nanoseconds = 999'999'999}).rfc3339(), "1969-12-31T23:59:59.999999999Z");
}

TEST(KsDate, writesYearsOfOtherLengthsWithTheirSign) {
    EXPECT_EQ((KsDate{.seconds = kYear0}).rfc3339(), "0000-01-01T00:00:00Z");
    EXPECT_EQ((KsDate{.seconds = kYear0 - 1}).rfc3339(), "-1-12-31T23:59:59Z");
    EXPECT_EQ((KsDate{.seconds = kYear10000 - 1}).rfc3339(), "9999-12-31T23:59:59Z");
    EXPECT_EQ((KsDate{.seconds = kYear10000}).rfc3339(), "+10000-01-01T00:00:00Z");
    EXPECT_EQ((KsDate{.seconds = std::numeric_limits<std::int64_t>::max(), .nanoseconds = 999'999'999}).rfc3339(),
              "+292277026596-12-04T15:30:07.999999999Z");
    EXPECT_EQ((KsDate{.seconds = std::numeric_limits<std::int64_t>::min()}).rfc3339(), "-292277022657-01-27T08:29:52Z");
}

TEST(KsDate, agreesWithTheCLibraryOnEveryDayOfTenThousandYears) {
    for (std::int64_t seconds = kYear0; seconds < kYear10000; seconds += 86'399) {
        ASSERT_EQ((KsDate{.seconds = seconds}).rfc3339(), textOfCLibrary(seconds)) << seconds;
    }
}

TEST(KsDate, appendsToWhatIsThere) {
    std::string text = "at ";
    KsDate{}.appendRFC3339(text);
    EXPECT_EQ(text, "at 1970-01-01T00:00:00Z");
}

TEST(KsDate, parsesWhatItWrote) {
    std::mt19937_64 random(1);
    std::uniform_int_distribution<std::int64_t> seconds(kYear0, kYear10000 - 1);
    std::uniform_int_distribution<std::uint32_t> nanoseconds(0, 999'999'999);
    for (int i = 0; i < 100'000; ++i) {
        const KsDate date{.seconds = seconds(random), .nanoseconds = nanoseconds(random)};
        ASSERT_EQ(KsDate::parseRFC3339(date.rfc3339()), date) << date.rfc3339();
    }
}

TEST(KsDate, parsesOffsetsDecimalsAndSmallLetters) {
    EXPECT_EQ(KsDate::parseRFC3339("1970-01-01T01:00:00+01:00"), KsDate{});
    EXPECT_EQ(KsDate::parseRFC3339("1969-12-31T18:30:00-05:30"), KsDate{});
    EXPECT_EQ(KsDate::parseRFC3339("1970-01-01T23:59:00+23:59"), KsDate{});
    EXPECT_EQ(KsDate::parseRFC3339("1970-01-01t00:00:00z"), KsDate{});
    EXPECT_EQ(KsDate::parseRFC3339("1970-01-01T00:00:00-00:00"), KsDate{});
    EXPECT_EQ(KsDate::parseRFC3339("1970-01-01T00:00:00.500Z"), (KsDate{.seconds = 0, .nanoseconds = 500'000'000}));
    EXPECT_EQ(KsDate::parseRFC3339("1969-12-31T23:59:59.000000001Z"), (KsDate{.seconds = -1, .nanoseconds = 1}));
    EXPECT_EQ(KsDate::parseRFC3339("0000-01-01T00:00:00+00:01"), (KsDate{.seconds = kYear0 - 60}));
}

TEST(KsDate, knowsTheLeapYears) {
    EXPECT_EQ(KsDate::parseRFC3339("2024-02-29T00:00:00Z"), (KsDate{.seconds = 1'709'164'800}));
    EXPECT_TRUE(KsDate::parseRFC3339("2000-02-29T00:00:00Z"));
    EXPECT_FALSE(KsDate::parseRFC3339("1900-02-29T00:00:00Z"));
    EXPECT_FALSE(KsDate::parseRFC3339("2023-02-29T00:00:00Z"));
}

// A leap second has no number of its own.
TEST(KsDate, countsALeapSecondAsTheOneThatFollows) {
    const auto newYear = KsDate::parseRFC3339("1991-01-01T00:00:00Z");
    ASSERT_TRUE(newYear);
    EXPECT_EQ(KsDate::parseRFC3339("1990-12-31T23:59:60Z"), newYear);
    EXPECT_EQ(KsDate::parseRFC3339("1990-12-31T15:59:60-08:00"), newYear);
    EXPECT_FALSE(KsDate::parseRFC3339("1990-12-30T23:59:60Z"));
    EXPECT_FALSE(KsDate::parseRFC3339("1990-12-31T23:58:60Z"));
    EXPECT_FALSE(KsDate::parseRFC3339("1990-12-31T23:59:60-08:00"));
    EXPECT_FALSE(KsDate::parseRFC3339("1990-12-31T23:59:61Z"));
}

TEST(KsDate, refusesEverythingElse) {
    for (const std::string_view text : {
             "",
             "now",
             "1970-01-01",
             "1970-01-01T00:00:00",
             "1970-01-01 00:00:00Z",
             "1970-01-01T00:00Z",
             "1970-01-01T00:00:00.Z",
             "1970-01-01T00:00:00.1234567890Z",
             "1970-01-01T00:00:00,5Z",
             "1970-1-01T00:00:00Z",
             "70-01-01T00:00:00Z",
             "+1970-01-01T00:00:00Z",
             "-1970-01-01T00:00:00Z",
             "+10000-01-01T00:00:00Z",
             "1970-00-01T00:00:00Z",
             "1970-13-01T00:00:00Z",
             "1970-01-00T00:00:00Z",
             "1970-01-32T00:00:00Z",
             "1970-04-31T00:00:00Z",
             "1970-01-01T24:00:00Z",
             "1970-01-01T00:60:00Z",
             "1970-01-01T00:00:00+24:00",
             "1970-01-01T00:00:00+00:60",
             "1970-01-01T00:00:00+0000",
             "1970-01-01T00:00:00+00",
             "1970-01-01T00:00:00Z ",
             " 1970-01-01T00:00:00Z",
             "1970-01-01T00:00:00ZZ",
             "1970-01-01T00:00:00\xE2\x88\x92"
             "01:00",
             "1970-01-01T00:00: 0Z",
             "1970-01-01T00:00:-1Z",
         }) {
        EXPECT_FALSE(KsDate::parseRFC3339(text)) << text;
    }
    EXPECT_FALSE(KsDate::parseRFC3339(std::string_view("1970-01-01T00:00:00Z\0", 21)));
}

TEST(KsDate, refusesEveryTruncation) {
    const std::string text = "2026-11-20T09:52:00.000000001+01:00";
    ASSERT_TRUE(KsDate::parseRFC3339(text));
    for (std::size_t length = 0; length < text.size(); ++length)
        EXPECT_FALSE(KsDate::parseRFC3339(text.substr(0, length))) << length;
}

TEST(KsDate, ordersByTime) {
    EXPECT_LT((KsDate{.seconds = -1, .nanoseconds = 999'999'999}), KsDate{});
    EXPECT_LT((KsDate{.seconds = 1, .nanoseconds = 1}), (KsDate{.seconds = 1, .nanoseconds = 2}));
}

TEST(KsDate, nowIsBetweenTwoLooksAtTheClock) {
    timespec before{};
    ::clock_gettime(CLOCK_REALTIME, &before);
    const KsDate now = KsDate::now();
    timespec after{};
    ::clock_gettime(CLOCK_REALTIME, &after);
    EXPECT_LE(KsDate::from(before), now);
    EXPECT_LE(now, KsDate::from(after));
}

}  // namespace
}  // namespace cindral
