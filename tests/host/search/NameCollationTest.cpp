#include "host/search/NameCollation.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace cindral::test {
namespace {

using ::testing::ElementsAre;

std::vector<std::string> sorted(const std::string& locale, std::vector<std::string> names) {
    const NameCollation collation(locale);
    std::ranges::sort(names, {}, [&](const std::string& name) { return collation.key(name); });
    return names;
}

TEST(NameCollation, ordersNumbersByTheirValue) {
    EXPECT_THAT(sorted("C", {"a10", "a9", "a100", "a1"}), ElementsAre("a1", "a9", "a10", "a100"));
}

TEST(NameCollation, ordersLettersAsPeopleDo) {
    EXPECT_THAT(sorted("", {"b", "A", "a", "B", "ä"}), ElementsAre("a", "A", "ä", "b", "B"));
}

TEST(NameCollation, followsTheLanguage) {
    EXPECT_THAT(sorted("sv_SE.UTF-8", {"ö", "z", "o"}), ElementsAre("o", "z", "ö"));
    EXPECT_THAT(sorted("de_DE.UTF-8@euro", {"ö", "z", "o"}), ElementsAre("o", "ö", "z"));
    EXPECT_NE(NameCollation("sv_SE").version(), NameCollation("de_DE").version());
}

TEST(NameCollation, takesAnyLocaleAndAnyBytes) {
    EXPECT_THAT(sorted("no such locale \xFF", {"b", "a"}), ElementsAre("a", "b"));
    EXPECT_NE(NameCollation("C").key("a\xFF"), NameCollation("C").key("a"));
    EXPECT_EQ(NameCollation("C").key(""), NameCollation("POSIX").key(""));
    const std::string longest(255, 'x');
    EXPECT_LT(NameCollation("C").key(longest), NameCollation("C").key(longest + "y"));
}

}  // namespace
}  // namespace cindral::test
