#include "host/TerminalText.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>
#include <limits>
#include <set>

namespace cindral {
namespace {

TEST(TerminalText, leavesNamesThatPeopleGiveAlone) {
    for (const char* name :
         {"report.txt", "Ann\xC3\xA4herung", "\xE6\x97\xA5\xE6\x9C\xAC", "\xF0\x9F\x99\x82 smile", "a b"})
        EXPECT_EQ(terminalText(name), name);
}

TEST(TerminalText, escapesWhatMovesTheCursor) {
    EXPECT_EQ(terminalText("a\nb\tc"), "a\\x0Ab\\x09c");
    EXPECT_EQ(terminalText("\x1B[2J"), "\\x1B[2J");
    EXPECT_EQ(terminalText("\x7F"), "\\x7F");
    // The eight-bit form of the escape sequence's beginning.
    EXPECT_EQ(terminalText("\xC2\x9B"
                           "2J"),
              "\\xC2\\x9B2J");
}

TEST(TerminalText, escapesBytesThatAreNotUtf8) {
    EXPECT_EQ(terminalText("a\xFFz\xE2\x82"), "a\\xFFz\\xE2\\x82");
    EXPECT_EQ(terminalText("\x9B"), "\\x9B");
}

TEST(TerminalText, escapesWhatTurnsTheDirectionOfText) {
    EXPECT_EQ(terminalText("a\xE2\x80\xAEgpj.exe"), "a\\xE2\\x80\\xAEgpj.exe");
    EXPECT_EQ(terminalText("\xE2\x81\xA6x"), "\\xE2\\x81\\xA6x");
    EXPECT_EQ(terminalText("\xE2\x80\xA8"), "\\xE2\\x80\\xA8");
}

// Two names never look alike: "\x0A" as four characters is not the newline.
TEST(TerminalText, showsDifferentNamesDifferently) {
    EXPECT_EQ(terminalText("\\x0A"), "\\\\x0A");
    std::set<std::string> shown;
    for (int byte = 1; byte < 256; ++byte) shown.insert(terminalText(std::string(1, static_cast<char>(byte))));
    EXPECT_EQ(shown.size(), 255U);
}

TEST(HumanSize, countsInThousands) {
    EXPECT_EQ(humanSize(0), "0 B");
    EXPECT_EQ(humanSize(999), "999 B");
    EXPECT_EQ(humanSize(1000), "1.0 kB");
    EXPECT_EQ(humanSize(1'234'567), "1.2 MB");
    EXPECT_EQ(humanSize(12'345'678), "12 MB");
    EXPECT_EQ(humanSize(340'000'000'000), "340 GB");
    EXPECT_EQ(humanSize(std::numeric_limits<std::uint64_t>::max()), "18 EB");
}

TEST(HumanSize, roundsIntoTheNextUnit) {
    EXPECT_EQ(humanSize(1049), "1.0 kB");
    EXPECT_EQ(humanSize(1050), "1.1 kB");
    EXPECT_EQ(humanSize(9'949), "9.9 kB");
    EXPECT_EQ(humanSize(9'950), "10 kB");
    EXPECT_EQ(humanSize(999'499), "999 kB");
    EXPECT_EQ(humanSize(999'500), "1.0 MB");
}

// The columns of a listing are as wide as this promises.
TEST(HumanSize, isNeverLongerThanSixCharacters) {
    for (std::uint64_t power = 1; power < 10'000'000'000'000'000'000U; power *= 10) {
        for (const std::uint64_t size : {power, power * 9 / 10 * 11 / 10, power * 9, power - 1}) {
            EXPECT_LE(humanSize(size).size(), 6U) << size;
        }
    }
}

class HumanDateTest : public ::testing::Test {
protected:
    HumanDateTest() {
        ::setenv("TZ", "UTC-1", 1);  // One hour east.
        ::tzset();
    }
    ~HumanDateTest() override {
        ::unsetenv("TZ");
        ::tzset();
    }
};

TEST_F(HumanDateTest, isInLocalTime) {
    const KsDate date{1'795'168'327, 999'999'999};
    EXPECT_EQ(humanMinute(date), "2026-11-20 10:52");
    EXPECT_EQ(humanMoment(date), "2026-11-20 10:52:07 +0100");
}

TEST_F(HumanDateTest, showsDatesThatNoCalendarHasAsUnknown) {
    EXPECT_EQ(humanMinute({std::numeric_limits<std::int64_t>::max(), 0}), "?");
}

}  // namespace
}  // namespace cindral
