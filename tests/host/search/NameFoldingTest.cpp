#include "host/search/NameFolding.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <set>

namespace cindral::test {
namespace {

using name_folding::fold;
using ::testing::Contains;
using ::testing::Each;
using ::testing::UnorderedElementsAre;

std::set<std::string> gramsOf(std::string_view name) {
    std::set<std::string> grams;
    name_grams::forEach(fold(name), [&](std::string_view gram) { return grams.emplace(gram).second || true; });
    return grams;
}

std::optional<NameMatch> match(std::string_view name, std::string_view text) {
    return nameMatchOf(fold(name), fold(text));
}

TEST(NameFolding, takesCaseAway) {
    EXPECT_EQ(fold("Report.TXT"), "report.txt");
    EXPECT_EQ(fold("ΣΊΣΥΦΟΣ"), fold("σίσυφος"));
    EXPECT_EQ(fold("STRASSE"), fold("straße"));
}

TEST(NameFolding, takesDiacriticsAway) {
    EXPECT_EQ(fold("Ünïcödé"), "unicode");
    EXPECT_EQ(fold("U\u0308nicode"), "unicode");
    EXPECT_EQ(fold("Łódź Ærø Þór ıđħŧœ"), "lodz aero thor idhtoe");
    EXPECT_EQ(fold("Й"), fold("И"));
}

TEST(NameFolding, leavesTheMarksThatAreWriting) {
    EXPECT_NE(fold("が"), fold("か"));
    EXPECT_EQ(fold("が"), fold("か\u3099"));
    EXPECT_NE(fold("की"), fold("क"));
}

TEST(NameFolding, takesDifferencesOfFormAway) {
    EXPECT_EQ(fold("ﬁle"), "file");
    EXPECT_EQ(fold("Ａ１"), "a1");
    EXPECT_EQ(fold("soft\u00ADhyphen"), "softhyphen");
}

TEST(NameFolding, leavesNoSlash) {
    EXPECT_EQ(fold("a/b"), fold("a／b"));
    EXPECT_EQ(fold("a/b").find('/'), std::string::npos);
    EXPECT_EQ(fold("℀").find('/'), std::string::npos);
}

TEST(NameFolding, showsBytesThatAreNoTextAsReplacements) {
    EXPECT_EQ(fold("a\xFF\xC3(b"), "a\uFFFD\uFFFD(b");
    EXPECT_EQ(fold(""), "");
}

// What is folded again is found by the same grams.
TEST(NameFolding, isDoneAfterOnce) {
    for (const std::string name : {"İstanbul", "ŉ", "ǰ", "ﷺ", "ÅÅ", "\u1E9E", "ᾳ", "a\u0300\u0345", "K", "９／８"})
        EXPECT_EQ(fold(fold(name)), fold(name)) << name;
}

TEST(NameMatch, knowsBeginningsWordsAndParts) {
    EXPECT_EQ(match("Report.txt", "rep"), NameMatch::prefix);
    EXPECT_EQ(match("My Report.txt", "rep"), NameMatch::word);
    EXPECT_EQ(match("my_report", "rep"), NameMatch::word);
    EXPECT_EQ(match("Prereport", "rep"), NameMatch::substring);
    EXPECT_EQ(match("Report.txt", "pot"), std::nullopt);
    EXPECT_EQ(match("Report.txt", ".txt"), NameMatch::substring) << "a word begins with a letter or digit";
    EXPECT_EQ(match("Report.txt", "txt"), NameMatch::word);
    EXPECT_EQ(match("prep rep", "rep"), NameMatch::word) << "the best place counts";
    EXPECT_EQ(match("Übung", "ubu"), NameMatch::prefix);
    EXPECT_EQ(match("中文名", "文"), NameMatch::substring);
}

TEST(NameGrams, areTriplesAndBeginningsAndWhatIsShortInOtherScripts) {
    EXPECT_THAT(gramsOf("ab c"), UnorderedElementsAre("ab ", "b c", "/a", "/ab", "c/"));
    EXPECT_THAT(gramsOf("中文"), UnorderedElementsAre("中", "文", "中文", "/中", "/中文"));
    EXPECT_THAT(gramsOf(""), UnorderedElementsAre());
}

// Whatever matches is among what the grams find.
TEST(NameGrams, ofATextAreInEveryNameThatMatches) {
    const std::string names[] = {"Report 2026.txt",
                                 "My_Räport-rep.TXT",
                                 "xrepx",
                                 "中文 Report",
                                 "a",
                                 "ab",
                                 "a\xFF"
                                 "b",
                                 "\"q\" AND"};
    const std::string texts[] = {"r",  "re",   "rep",  "report", "2026.t", "t 2",   "räp",
                                 "中", "中文", "文 r", "a",      "\xFF",   "\"q\"", "ab"};
    int matches = 0;
    for (const std::string& name : names) {
        const auto grams = gramsOf(name);
        for (const std::string& text : texts) {
            const auto found = match(name, text);
            if (!found) continue;
            ++matches;
            for (const std::string& gram : name_grams::required(fold(text), *found))
                EXPECT_THAT(grams, Contains(gram)) << name << " by " << text;
        }
    }
    EXPECT_EQ(matches, 28);
}

TEST(NameGrams, ofALongTextAreFew) {
    const auto grams = name_grams::required(std::string(5'000, 'x') + "yz", NameMatch::prefix);
    EXPECT_LE(grams.size(), 20U);
    EXPECT_THAT(grams, Contains("/xx"));
    EXPECT_THAT(grams, Contains("xyz"));
}

}  // namespace
}  // namespace cindral::test
