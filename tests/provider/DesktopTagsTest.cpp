#include "provider/DesktopTags.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace cindral::test {
namespace {

using ::testing::ElementsAre;
using ::testing::Optional;

std::optional<std::vector<std::string>> decoded(std::string_view text) {
    return desktop_tags::decode(bytesOf(text));
}

std::optional<std::string> encoded(const std::vector<std::string>& labels) {
    const auto bytes = desktop_tags::encode(labels);
    return bytes ? std::optional(std::string(textOf(*bytes))) : std::nullopt;
}

TEST(DesktopTags, areSeparatedByCommas) {
    EXPECT_THAT(decoded("work"), Optional(ElementsAre("work")));
    EXPECT_THAT(decoded("work,zu Hause, später "), Optional(ElementsAre("work", "zu Hause", "später")));
}

TEST(DesktopTags, leaveOutWhatIsNone) {
    EXPECT_THAT(decoded(",a,, ,a,b,"), Optional(ElementsAre("a", "b")));
    EXPECT_THAT(decoded("a\xFF,b"), Optional(ElementsAre("b")));
    EXPECT_THAT(decoded(std::string_view("a,b\0c", 5)), Optional(ElementsAre("a", "b")));
    for (const char* text : {"", ",", " , ", "\xFF"}) EXPECT_EQ(decoded(text), std::nullopt) << text;
}

TEST(DesktopTags, areWrittenAsTheyAreRead) {
    EXPECT_EQ(encoded({"work", "zu Hause"}), "work,zu Hause");
    EXPECT_EQ(encoded({}), std::nullopt);
}

TEST(DesktopTags, leaveOutWhatWouldBeReadOtherwise) {
    EXPECT_EQ(encoded({"a,b", "c", " d", "", "\xFF", std::string("e\0f", 3)}), "c");
    EXPECT_EQ(encoded({"a,b"}), std::nullopt);
}

}  // namespace
}  // namespace cindral::test
