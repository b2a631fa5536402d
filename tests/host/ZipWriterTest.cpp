#include "host/http/ZipWriter.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <string_view>

namespace cindral {
namespace {

/// What an archive says of itself at its end, as a reader finds it there.
struct Ending {
    std::uint64_t entries = 0;
    std::uint64_t listBytes = 0;
    std::uint64_t listBegin = 0;
    bool isLong = false;
};

std::uint64_t number(std::string_view bytes, std::size_t at, int length) {
    std::uint64_t value = 0;
    for (int i = length - 1; i >= 0; --i)
        value = value << 8 | static_cast<unsigned char>(bytes.at(at + static_cast<std::size_t>(i)));
    return value;
}

Ending endingOf(std::string_view archive) {
    const std::size_t end = archive.size() - 22;
    EXPECT_EQ(archive.substr(end, 4), "PK\x05\x06");
    Ending ending{number(archive, end + 10, 2), number(archive, end + 12, 4), number(archive, end + 16, 4)};
    if (end < 20 || archive.substr(end - 20, 4) != "PK\x06\x07") return ending;
    const auto longer = static_cast<std::size_t>(number(archive, end - 12, 8));
    EXPECT_EQ(archive.substr(longer, 4), std::string_view("PK\x06\x06"));
    return {number(archive, longer + 32, 8), number(archive, longer + 40, 8), number(archive, longer + 48, 8), true};
}

class ZipWriterTest : public ::testing::Test {
protected:
    std::string archive_;
    ZipWriter writer_{[this](std::string_view bytes) {
        archive_ += bytes;
        return true;
    }};

    void add(const std::string& path, std::string_view contents) {
        EXPECT_TRUE(writer_.beginDocument({path, {}, contents.size()}));
        EXPECT_TRUE(writer_.append(contents));
        EXPECT_TRUE(writer_.endDocument());
    }
};

TEST_F(ZipWriterTest, endsWithTheListOfAllThatIsInIt) {
    add("a.txt", "a");
    EXPECT_TRUE(writer_.addFolder("b", {}));
    EXPECT_TRUE(writer_.finish());
    const Ending ending = endingOf(archive_);
    EXPECT_EQ(ending.entries, 2U);
    EXPECT_FALSE(ending.isLong);
    EXPECT_EQ(archive_.substr(ending.listBegin, 4), "PK\x01\x02");
    EXPECT_EQ(ending.listBegin + ending.listBytes + 22, archive_.size());
}

TEST_F(ZipWriterTest, isAnArchiveAlsoWithNothingInIt) {
    EXPECT_TRUE(writer_.finish());
    EXPECT_EQ(archive_.size(), 22U);
    EXPECT_EQ(endingOf(archive_).entries, 0U);
}

// 65,535 is what stands for "more": the last number that is written short is the one before it.
TEST_F(ZipWriterTest, countsBeyondSixteenBits) {
    for (int i = 0; i < 65'534; ++i) EXPECT_TRUE(writer_.addFolder(std::to_string(i), {}));
    EXPECT_TRUE(writer_.finish());
    EXPECT_FALSE(endingOf(archive_).isLong);
    EXPECT_EQ(endingOf(archive_).entries, 65'534U);
}

TEST_F(ZipWriterTest, countsBeyondSixteenBitsInTheLongerEnding) {
    for (int i = 0; i < 70'000; ++i) EXPECT_TRUE(writer_.addFolder(std::to_string(i), {}));
    EXPECT_TRUE(writer_.finish());
    const Ending ending = endingOf(archive_);
    EXPECT_TRUE(ending.isLong);
    EXPECT_EQ(ending.entries, 70'000U);
    EXPECT_EQ(archive_.substr(ending.listBegin, 4), "PK\x01\x02");
    EXPECT_EQ(ending.listBegin + ending.listBytes + 56 + 20 + 22, archive_.size());
}

// How long the numbers are stands before the bytes: what is promised decides, not what comes.
TEST_F(ZipWriterTest, writesLongNumbersOfADocumentThatMayNeedThem) {
    EXPECT_TRUE(writer_.beginDocument({"big", {}, std::uint64_t{5} << 30}));
    EXPECT_TRUE(writer_.append("abc"));
    EXPECT_TRUE(writer_.endDocument());
    EXPECT_TRUE(writer_.finish());
    const Ending ending = endingOf(archive_);
    const std::size_t list = ending.listBegin;
    EXPECT_EQ(number(archive_, list + 20, 4), 0xFFFFFFFFU) << "packed";
    EXPECT_EQ(number(archive_, list + 24, 4), 0xFFFFFFFFU);
    // Behind the name and the moment: the field of the longer numbers.
    const std::size_t field = list + 46 + 3 + 9;
    EXPECT_EQ(number(archive_, field, 2), 1U);
    EXPECT_EQ(number(archive_, field + 4, 8), 3U);
}

TEST_F(ZipWriterTest, saysWhichNamesAreUtf8) {
    add("gr\xC3\xB6\xC3\x9F"
        "e",
        "");
    add("bad\xFF", "");
    EXPECT_TRUE(writer_.finish());
    const std::size_t list = endingOf(archive_).listBegin;
    EXPECT_EQ(number(archive_, list + 8, 2) & 0x800, 0x800U);
    const std::size_t second = archive_.find("PK\x01\x02", list + 4);
    EXPECT_EQ(number(archive_, second + 8, 2) & 0x800, 0U);
}

TEST_F(ZipWriterTest, holdsNoPathThatIsTooLong) {
    EXPECT_TRUE(ZipWriter::canHold(std::string(65'534, 'x')));
    EXPECT_FALSE(ZipWriter::canHold(std::string(65'535, 'x')));
    EXPECT_TRUE(ZipWriter::canHold(std::string(21'844, '\\')));
    EXPECT_FALSE(ZipWriter::canHold(std::string(21'845, '\\')));
}

TEST(ZipWriter, endsWhenNobodyTakesAnyMore) {
    int calls = 0;
    ZipWriter writer([&](std::string_view) { return ++calls < 2; });
    EXPECT_TRUE(writer.addFolder("a", {}));
    EXPECT_FALSE(writer.addFolder("b", {}));
    EXPECT_FALSE(writer.beginDocument({"c", {}, 1}));
    (void)writer.append("x");
    EXPECT_FALSE(writer.endDocument());
    EXPECT_FALSE(writer.finish());
    EXPECT_EQ(calls, 2);
}

}  // namespace
}  // namespace cindral
