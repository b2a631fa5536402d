#include "platform/tessel/FreeName.h"

#include <gtest/gtest.h>

namespace cindral {
namespace {

std::string second(std::string_view name, NameKind kind = NameKind::document) {
    return alternativeName(name, kind, 2);
}

TEST(FreeName, goesBeforeTheExtension) {
    EXPECT_EQ(second("Report.txt"), "Report 2.txt");
    EXPECT_EQ(second("a.b.c"), "a.b 2.c");
    EXPECT_EQ(alternativeName("Report.txt", NameKind::document, 117), "Report 117.txt");
}

TEST(FreeName, goesAtTheEndWithoutOne) {
    EXPECT_EQ(second("Report"), "Report 2");
    EXPECT_EQ(second(".profile"), ".profile 2");
    EXPECT_EQ(second("..."), "... 2");
    EXPECT_EQ(second("..profile"), "..profile 2");
    EXPECT_EQ(second("..a.txt"), "..a 2.txt");
    EXPECT_EQ(second("v1.2", NameKind::folder), "v1.2 2");
    EXPECT_EQ(second("Mr. " + std::string(40, 'x')), "Mr. " + std::string(40, 'x') + " 2");
}

TEST(FreeName, isNeverTooLong) {
    for (const std::size_t length : {250U, 253U, 254U, 255U}) {
        const std::string name = second(std::string(length, 'x') + ".txt");
        EXPECT_EQ(name.size(), 255U);
        EXPECT_TRUE(name.ends_with("x 2.txt"));
    }
}

TEST(FreeName, isCutBetweenCharacters) {
    std::string name;
    while (name.size() < 252) name += "\xe2\x82\xac";  // Three bytes each.
    for (const std::string_view lead : {"", "a", "ab"}) {
        std::string cut = second(std::string(lead) + name);
        ASSERT_TRUE(cut.ends_with(" 2"));
        cut.resize(cut.size() - 2);
        EXPECT_LE(cut.size(), 253U);
        EXPECT_EQ((cut.size() - lead.size()) % 3, 0U);
    }
    // Where there are no characters, anywhere will do.
    EXPECT_EQ(second(std::string(255, '\x80')).size(), 255U);
}

}  // namespace
}  // namespace cindral
