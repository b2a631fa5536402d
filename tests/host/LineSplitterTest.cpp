#include "host/LineSplitter.h"

#include <gtest/gtest.h>

#include <vector>

namespace cindral {
namespace {

constexpr std::size_t kMax = 8;
const std::string kTooLong = "<too long>";

class Lines final : public LineSplitter::Receiver {
public:
    void didReadLine(std::string_view line) override { lines.emplace_back(line); }
    void didSkipLongLine() override { lines.push_back(kTooLong); }
    std::vector<std::string> lines;
};

std::vector<std::string> split(std::string_view text, std::size_t pieceBytes) {
    Lines lines;
    LineSplitter splitter(lines, kMax);
    for (std::size_t i = 0; i < text.size(); i += pieceBytes) splitter.feed(text.substr(i, pieceBytes));
    splitter.finish();
    return lines.lines;
}

using Texts = std::vector<std::string>;

TEST(LineSplitter, cutsAtNewlines) {
    EXPECT_EQ(split("one\ntwo\n\nthree\n", 100), (Texts{"one", "two", "", "three"}));
}

TEST(LineSplitter, takesWhatStandsAfterTheLastNewlineForALine) {
    EXPECT_EQ(split("one\ntwo", 100), (Texts{"one", "two"}));
    EXPECT_EQ(split("", 100), Texts{});
}

TEST(LineSplitter, takesALineOfExactlyTheLimit) {
    EXPECT_EQ(split("12345678\n1\n", 100), (Texts{"12345678", "1"}));
    EXPECT_EQ(split("12345678", 100), (Texts{"12345678"}));
}

TEST(LineSplitter, skipsALongerLineToItsEnd) {
    EXPECT_EQ(split("123456789\nafter\n", 100), (Texts{kTooLong, "after"}));
    EXPECT_EQ(split("before\n1234567890123456789012345678901234567890\nafter\n", 100),
              (Texts{"before", kTooLong, "after"}));
    EXPECT_EQ(split("1234567890", 100), (Texts{kTooLong}));
}

// However the bytes arrive, the lines are the same.
TEST(LineSplitter, givesTheSameLinesForEverySizeOfPiece) {
    const std::string text = "12345678\n123456789\n\nabc\n1234567890123456789\nend";
    const Texts whole = split(text, text.size());
    EXPECT_EQ(whole, (Texts{"12345678", kTooLong, "", "abc", kTooLong, "end"}));
    for (std::size_t size = 1; size < text.size(); ++size) EXPECT_EQ(split(text, size), whole) << size;
}

}  // namespace
}  // namespace cindral
