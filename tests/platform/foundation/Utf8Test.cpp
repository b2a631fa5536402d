#include "platform/foundation/Utf8.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace cindral {
namespace {

/// Lengths of the steps through the text; negative where what was stepped over is no character.
std::vector<int> steps(std::string_view text) {
    std::vector<int> lengths;
    while (!text.empty()) {
        const Utf8Step step = utf8Step(text);
        lengths.push_back(step.isValid ? static_cast<int>(step.length) : -static_cast<int>(step.length));
        text.remove_prefix(step.length);
    }
    return lengths;
}

using Lengths = std::vector<int>;

TEST(Utf8, readsCharactersOfEveryLength) {
    EXPECT_EQ(steps("a\xC3\xA4\xE2\x82\xAC\xF0\x9F\x99\x82"), (Lengths{1, 2, 3, 4}));
    EXPECT_EQ(utf8Step("\xF0\x9F\x99\x82").character, U'\U0001F642');
    EXPECT_EQ(utf8Step("\xE2\x82\xAC").character, U'\u20AC');
    EXPECT_EQ(utf8Step(std::string_view("\0", 1)).character, U'\0');
}

TEST(Utf8, readsTheFirstAndLastCharacterOfEachLength) {
    for (const char* text : {"\xC2\x80", "\xDF\xBF", "\xE0\xA0\x80", "\xED\x9F\xBF", "\xEE\x80\x80", "\xEF\xBF\xBF",
                             "\xF0\x90\x80\x80", "\xF4\x8F\xBF\xBF"}) {
        EXPECT_TRUE(isUtf8(text)) << text;
    }
}

// The example of the Unicode standard's chapter on conformance: 61 F1 80 80 E1 80 C2 62 80 63 80 BF 64.
TEST(Utf8, cutsMaximalSubparts) {
    EXPECT_EQ(steps("\x61\xF1\x80\x80\xE1\x80\xC2\x62\x80\x63\x80\xBF\x64"),
              (Lengths{1, -3, -2, -1, 1, -1, 1, -1, -1, 1}));
}

TEST(Utf8, cutsOverlongFormsSurrogatesAndWhatIsTooLargeIntoBytes) {
    EXPECT_EQ(steps("\xC0\xAF"), (Lengths{-1, -1}));
    EXPECT_EQ(steps("\xE0\x80\xBF"), (Lengths{-1, -1, -1}));
    EXPECT_EQ(steps("\xED\xA0\x80"), (Lengths{-1, -1, -1}));
    EXPECT_EQ(steps("\xF4\x91\x92\x93"), (Lengths{-1, -1, -1, -1}));
    EXPECT_EQ(steps("\xFF\xFE"), (Lengths{-1, -1}));
}

TEST(Utf8, cutsATruncatedCharacterAsOne) {
    EXPECT_EQ(steps("\xF0\x9F\x99"), (Lengths{-3}));
    EXPECT_EQ(steps("\xE2\x82"), (Lengths{-2}));
}

// Every text of two bytes: the steps cover it, and a valid step is what its character encodes to.
TEST(Utf8, stepsOverEveryPairOfBytes) {
    for (int first = 0; first < 256; ++first) {
        for (int second = 0; second < 256; ++second) {
            const std::string text{static_cast<char>(first), static_cast<char>(second)};
            int covered = 0;
            for (const int length : steps(text)) covered += std::abs(length);
            ASSERT_EQ(covered, 2);
            const bool isTwoByteCharacter = first >= 0xC2 && first <= 0xDF && second >= 0x80 && second <= 0xBF;
            ASSERT_EQ(isUtf8(text), (first < 0x80 && second < 0x80) || isTwoByteCharacter) << first << ' ' << second;
        }
    }
}

}  // namespace
}  // namespace cindral
