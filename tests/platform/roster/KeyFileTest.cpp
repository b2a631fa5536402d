#include "platform/roster/KeyFile.h"

#include <gtest/gtest.h>

namespace cindral {
namespace {

using Names = std::vector<std::string>;

KeyFile parsed(std::string_view text) {
    auto file = KeyFile::parse(text);
    EXPECT_TRUE(file) << text;
    return file.value_or(KeyFile());
}

TEST(KeyFile, readsGroupsAndKeys) {
    const KeyFile file =
        parsed("# comment\n\n[Desktop Entry]\nName=Writer\nType = Application \n\n[Other]\nName=x=y\n");
    EXPECT_EQ(file.string("Desktop Entry", "Name"), "Writer");
    EXPECT_EQ(file.string("Desktop Entry", "Type"), "Application");
    EXPECT_EQ(file.string("Other", "Name"), "x=y");
    EXPECT_EQ(file.string("Other", "Type"), std::nullopt);
    EXPECT_EQ(file.string("None", "Name"), std::nullopt);
    EXPECT_EQ(file.groups(), (Names{"Desktop Entry", "Other"}));
    EXPECT_EQ(file.keys("Desktop Entry"), (Names{"Name", "Type"}));
    EXPECT_TRUE(file.keys("None").empty());
}

TEST(KeyFile, theLastOfSeveralValuesCounts) {
    const KeyFile file = parsed("[A]\nk=1\nk=2\n[B]\nk=3\n[A]\nk=4\n");
    EXPECT_EQ(file.string("A", "k"), "4");
}

TEST(KeyFile, readsLinesOfOtherSystems) {
    EXPECT_EQ(parsed("[A]\r\nk=v\r\n").string("A", "k"), "v");
    EXPECT_EQ(parsed("[A]\nk=v").string("A", "k"), "v");
    EXPECT_EQ(parsed("").groups(), Names());
}

TEST(KeyFile, undoesEscapes) {
    const KeyFile file = parsed("[A]\nk=a\\sb\\nc\\td\\re\\\\f\\x\\\n");
    EXPECT_EQ(file.string("A", "k"), "a b\nc\td\re\\f\\x\\");
    EXPECT_EQ(*file.value("A", "k"), "a\\sb\\nc\\td\\re\\\\f\\x\\");
}

TEST(KeyFile, aBooleanIsTrueOrFalse) {
    const KeyFile file = parsed("[A]\nyes=true\nno=false\none=1\ncut=tr\nempty=\n");
    EXPECT_EQ(file.boolean("A", "yes"), true);
    EXPECT_EQ(file.boolean("A", "no"), false);
    for (const char* key : {"one", "cut", "empty", "absent"}) EXPECT_EQ(file.boolean("A", key), std::nullopt) << key;
}

TEST(KeyFile, aTextWithAnyOtherLineIsNone) {
    for (const std::string& text :
         {std::string("k=v\n"), std::string("[A\n"), std::string("[A]\nX-Cindral-Supp"), std::string("[A]\n=v\n"),
          std::string("[A]\nno equals\n"), std::string("[A]\nk=\0\n", 8)}) {
        EXPECT_FALSE(KeyFile::parse(text)) << text;
    }
    EXPECT_TRUE(KeyFile::parse(std::string(KeyFile::kBytesMax, '#')));
    EXPECT_FALSE(KeyFile::parse(std::string(KeyFile::kBytesMax + 1, '#')));
}

TEST(KeyFile, keepsBytesThatAreNoText) {
    EXPECT_EQ(parsed("[A]\nk=\xff\xfe\n").string("A", "k"), "\xff\xfe");
}

TEST(KeyFile, choosesTheNearestLocale) {
    const KeyFile file =
        parsed("[A]\nName=Plain\nName[sr]=Sr\nName[sr_YU]=SrYU\nName[sr@Latn]=SrLatn\nName[de]=De\nOnly[sr@Latn]=x\n");
    const auto name = [&](std::string_view locale) {
        return file.localizedString("A", "Name", localeNames(locale)).value_or("none");
    };
    EXPECT_EQ(name("sr_YU@Latn"), "SrYU");
    EXPECT_EQ(name("sr_YU.UTF-8"), "SrYU");
    EXPECT_EQ(name("sr_ME@Latn"), "SrLatn");
    EXPECT_EQ(name("sr@Latn"), "SrLatn");
    EXPECT_EQ(name("sr_ME"), "Sr");
    EXPECT_EQ(name("de_AT.UTF-8@euro"), "De");
    EXPECT_EQ(name("fr_FR"), "Plain");
    EXPECT_EQ(name("C"), "Plain");
    EXPECT_EQ(file.localizedString("A", "Only", localeNames("de")), std::nullopt);
}

TEST(LocaleNames, goFromTheNearestToTheLanguage) {
    EXPECT_EQ(localeNames("sr_YU.UTF-8@Latn"), (Names{"sr_YU@Latn", "sr_YU", "sr@Latn", "sr"}));
    EXPECT_EQ(localeNames("de_AT.UTF-8"), (Names{"de_AT", "de"}));
    EXPECT_EQ(localeNames("ca@valencia"), (Names{"ca@valencia", "ca"}));
    EXPECT_EQ(localeNames("eo"), Names{"eo"});
    for (const char* none : {"", "C", "C.UTF-8", "POSIX", ".UTF-8", "@x", "_DE"})
        EXPECT_EQ(localeNames(none), Names()) << none;
}

}  // namespace
}  // namespace cindral
