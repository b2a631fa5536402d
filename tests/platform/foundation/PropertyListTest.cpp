#include "platform/foundation/PropertyList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cmath>
#include <limits>
#include <random>

#include "support/Hex.h"

namespace cindral {
namespace {

using Array = PropertyList::Array;
using Dictionary = PropertyList::Dictionary;
using test::bytesFromHex;
using test::hexFromBytes;

constexpr double kInfinity = std::numeric_limits<double>::infinity();
constexpr std::int64_t kSecondsFrom1970To2001 = 978'307'200;

PropertyList number(std::uint64_t value) {
    return value;
}

PropertyList negative(std::int64_t value) {
    return value;
}

void appendBigEndian(Bytes& bytes, std::uint64_t value, std::size_t size) {
    for (std::size_t i = size; i > 0; --i)
        bytes.push_back(i > 8 ? std::byte{0} : static_cast<std::byte>(value >> 8 * (i - 1)));
}

std::string bigEndian(std::uint64_t value, std::size_t size) {
    Bytes bytes;
    appendBigEndian(bytes, value, size);
    return hexFromBytes(bytes);
}

/// A binary property list made by hand, so that any part of it can be wrong.
struct Forgery {
    std::vector<std::string> objects;  ///< hexadecimal digits
    std::string header = "bplist00";
    std::vector<std::uint64_t> offsets = {};  ///< where they are not the true ones
    std::size_t offsetSize = 1;
    std::size_t referenceSize = 1;
    std::optional<std::uint64_t> statedOffsetSize = std::nullopt;
    std::optional<std::uint64_t> objectCount = std::nullopt;
    std::uint64_t topObject = 0;
    std::optional<std::uint64_t> table = std::nullopt;
    std::string unused = "000000000000";

    Bytes bytes() const {
        Bytes file(bytesOf(header).begin(), bytesOf(header).end());
        std::vector<std::uint64_t> trueOffsets;
        for (const std::string& object : objects) {
            trueOffsets.push_back(file.size());
            const Bytes content = bytesFromHex(object);
            file.insert(file.end(), content.begin(), content.end());
        }
        const std::uint64_t trueTable = file.size();
        for (const std::uint64_t offset : offsets.empty() ? trueOffsets : offsets)
            appendBigEndian(file, offset, offsetSize);
        const Bytes unusedBytes = bytesFromHex(unused);
        file.insert(file.end(), unusedBytes.begin(), unusedBytes.end());
        appendBigEndian(file, statedOffsetSize.value_or(offsetSize), 1);
        appendBigEndian(file, referenceSize, 1);
        appendBigEndian(file, objectCount.value_or(objects.size()), 8);
        appendBigEndian(file, topObject, 8);
        appendBigEndian(file, table.value_or(trueTable), 8);
        return file;
    }
};

std::optional<PropertyList> decoded(ByteView bytes) {
    Result<PropertyList> list = PropertyList::decodeBinary(bytes);
    if (!list) {
        EXPECT_TRUE(list.error().isPosix(EINVAL));
        EXPECT_TRUE(list.error().userInfo().contains("message"));
        return std::nullopt;
    }
    return std::move(list).value();
}

std::optional<PropertyList> decoded(const Forgery& forgery) {
    return decoded(forgery.bytes());
}

std::optional<PropertyList> decodedObject(const std::string& object) {
    return decoded(Forgery{.objects = {object}});
}

/// Why it is refused; empty when it is not.
std::string refusal(const Forgery& forgery) {
    const Result<PropertyList> list = PropertyList::decodeBinary(forgery.bytes());
    if (list) return "";
    EXPECT_TRUE(list.error().isPosix(EINVAL));
    return list.error().userInfo().at("message");
}

std::string refusalOfObject(const std::string& object) {
    return refusal(Forgery{.objects = {object}});
}

/// The encoded object of a scalar: what stands between the header and the offset table.
std::string encodedScalar(const PropertyList& value) {
    const Bytes bytes = value.encodeBinary();
    constexpr std::size_t kHeaderSize = 8;
    constexpr std::size_t kTrailerSize = 32;
    const std::uint64_t table =
        std::to_integer<std::uint64_t>(bytes.back()) + 256 * std::to_integer<std::uint64_t>(bytes[bytes.size() - 2]);
    EXPECT_LE(table, bytes.size() - kTrailerSize);
    return hexFromBytes(ByteView(bytes).subspan(kHeaderSize, table - kHeaderSize));
}

/// Arrays within each other; the innermost is empty.
PropertyList nested(unsigned levels) {
    PropertyList list = Array{};
    for (unsigned i = 1; i < levels; ++i) list = Array{std::move(list)};
    return list;
}

PropertyList everyType() {
    return Dictionary{
        {"array", Array{number(0), number(255), number(256), number(65'536), number(std::uint64_t{1} << 32)}},
        {"data", bytesFromHex("00ff7f")},
        {"date", KsDate{.seconds = 1'795'168'320, .nanoseconds = 500'000'000}},
        {"empty", Dictionary{}},
        {"false", false},
        {"most", std::numeric_limits<std::uint64_t>::max()},
        {"negative", negative(-1)},
        {"real", 1.5},
        {"text", "plain"},
        {"text €", "漢字 \xF0\x9F\x98\x80 \xFF"},
        {"true", true},
    };
}

// --- What is written, and read for ever ----------------------------------------------------------------------------

struct Golden {
    PropertyList value;
    std::string_view hex;
};

// Files of users hold these bytes. Never change one; a new form is a new row.
std::vector<Golden> goldens() {
    return {
        {everyType(),
         "62706c6973743030"
         "db0102030405060708090a0b0c0d0e0f101112131415165561727261795464617461546461746555656d707479556661"
         "6c7365546d6f7374586e65676174697665547265616c5474657874660074006500780074002020ac5474727565a51718"
         "191a1b4300ff7f3341c85827e0400000d008140000000000000000ffffffffffffffff13ffffffffffffffff233ff800"
         "000000000055706c61696e676f225b570020d83dde000020dcff09100010ff1101001200010000130000000100000000"
         "081f252a2f353b40494e5360656b6f78797a8b949da3b2b3b5b7babf"
         "0000000000000101000000000000001c000000000000000000000000000000c8"},
        {Array{},
         "62706c6973743030"
         "a008"
         "0000000000000101000000000000000100000000000000000000000000000009"},
        {Dictionary{},
         "62706c6973743030"
         "d008"
         "0000000000000101000000000000000100000000000000000000000000000009"},
        {PropertyList(""),
         "62706c6973743030"
         "5008"
         "0000000000000101000000000000000100000000000000000000000000000009"},
        {true,
         "62706c6973743030"
         "0908"
         "0000000000000101000000000000000100000000000000000000000000000009"},
        {std::numeric_limits<std::uint64_t>::max(),
         "62706c6973743030"
         "140000000000000000ffffffffffffffff08"
         "0000000000000101000000000000000100000000000000000000000000000019"},
        {KsDate{.seconds = -1, .nanoseconds = 500'000'000},
         "62706c6973743030"
         "33c1cd27e44040000008"
         "0000000000000101000000000000000100000000000000000000000000000011"},
        {Array(20, "shared"),
         "62706c6973743030"
         "af10140102030405060708090a0b0c0d0e0f101112131456736861726564567368617265645673686172656456736861"
         "726564567368617265645673686172656456736861726564567368617265645673686172656456736861726564567368"
         "617265645673686172656456736861726564567368617265645673686172656456736861726564567368617265645673"
         "68617265645673686172656456736861726564081f262d343b424950575e656c737a81888f969da4"
         "00000000000001010000000000000015000000000000000000000000000000ab"},
    };
}

TEST(PropertyList, writesTheGoldenBytes) {
    for (const Golden& golden : goldens())
        EXPECT_EQ(hexFromBytes(golden.value.encodeBinary()), hexFromBytes(bytesFromHex(golden.hex)));
}

TEST(PropertyList, readsTheGoldenBytes) {
    for (const Golden& golden : goldens()) EXPECT_EQ(decoded(bytesFromHex(golden.hex)), golden.value) << golden.hex;
}

TEST(PropertyList, writesEachNumberInItsForm) {
    EXPECT_EQ(encodedScalar(number(0)), "1000");
    EXPECT_EQ(encodedScalar(number(0xFF)), "10ff");
    EXPECT_EQ(encodedScalar(number(0x100)), "110100");
    EXPECT_EQ(encodedScalar(number(0xFFFF)), "11ffff");
    EXPECT_EQ(encodedScalar(number(0x1'0000)), "1200010000");
    EXPECT_EQ(encodedScalar(number(0xFFFF'FFFF)), "12ffffffff");
    EXPECT_EQ(encodedScalar(number(0x1'0000'0000)), "130000000100000000");
    EXPECT_EQ(encodedScalar(number(0x7FFF'FFFF'FFFF'FFFF)), "137fffffffffffffff");
    EXPECT_EQ(encodedScalar(number(0x8000'0000'0000'0000)), "1400000000000000008000000000000000");
    EXPECT_EQ(encodedScalar(number(0xFFFF'FFFF'FFFF'FFFF)), "140000000000000000ffffffffffffffff");
    EXPECT_EQ(encodedScalar(negative(-1)), "13ffffffffffffffff");
    EXPECT_EQ(encodedScalar(std::numeric_limits<std::int64_t>::min()), "138000000000000000");
    EXPECT_EQ(encodedScalar(1.5), "233ff8000000000000");
    EXPECT_EQ(encodedScalar(true), "09");
    EXPECT_EQ(encodedScalar(false), "08");
}

TEST(PropertyList, writesLengthsFrom15OnAsIntegers) {
    EXPECT_EQ(encodedScalar(std::string(14, 'a')), "5e" + hexFromBytes(bytesOf(std::string(14, 'a'))));
    EXPECT_EQ(encodedScalar(std::string(15, 'a')), "5f100f" + hexFromBytes(bytesOf(std::string(15, 'a'))));
    EXPECT_EQ(encodedScalar(Bytes(256)), "4f110100" + std::string(512, '0'));
}

TEST(PropertyList, holdsNonNegativeIntegersUnsigned) {
    EXPECT_EQ(PropertyList(std::int64_t{7}), number(7));
    EXPECT_EQ(PropertyList(std::int64_t{0}), number(0));
    EXPECT_FALSE(PropertyList(std::int64_t{7}).negativeInteger());
    EXPECT_TRUE(negative(-7).negativeInteger());
    EXPECT_FALSE(negative(-7).unsignedInteger());
}

TEST(PropertyList, findsValuesOfDictionariesOnly) {
    const PropertyList list = Dictionary{{"a", number(1)}};
    ASSERT_TRUE(list.find("a"));
    EXPECT_EQ(*list.find("a"), number(1));
    EXPECT_FALSE(list.find("b"));
    EXPECT_FALSE(PropertyList("a").find("a"));
    EXPECT_FALSE(PropertyList(Array{"a"}).find("a"));
}

TEST(PropertyList, decodesWhatItEncoded) {
    for (const PropertyList& value : {everyType(), PropertyList(Array{}), PropertyList(Array{everyType(), everyType()}),
                                      PropertyList(""), PropertyList(Bytes{}), PropertyList(Dictionary{{"", ""}}),
                                      PropertyList(kInfinity), PropertyList(-kInfinity), PropertyList(5e-324)}) {
        EXPECT_EQ(decoded(value.encodeBinary()), value);
    }
}

// References and offsets grow from one byte to two, and to four.
TEST(PropertyList, decodesWhatItEncodedOfAnySize) {
    for (const std::size_t count : {14U, 15U, 254U, 255U, 256U, 65'534U, 65'535U, 65'536U, 200'000U}) {
        const PropertyList numbers = Array(count, number(1));
        EXPECT_TRUE(decoded(numbers.encodeBinary()) == numbers) << count;
        const PropertyList text = std::string(count, 'x');
        EXPECT_TRUE(decoded(text.encodeBinary()) == text) << count;
    }
    Dictionary dictionary;
    for (int i = 0; i < 40'000; ++i) dictionary.emplace("key " + std::to_string(i), Array{std::to_string(i)});
    const PropertyList list = std::move(dictionary);
    EXPECT_TRUE(decoded(list.encodeBinary()) == list);
}

TEST(PropertyList, equalValuesHaveEqualBytes) {
    Dictionary forward;
    Dictionary backward;
    for (int i = 0; i < 100; ++i) {
        forward.emplace(std::to_string(i), number(static_cast<unsigned>(i)));
        backward.emplace(std::to_string(99 - i), number(static_cast<unsigned>(99 - i)));
    }
    ASSERT_EQ(PropertyList(forward), PropertyList(backward));
    EXPECT_EQ(PropertyList(forward).encodeBinary(), PropertyList(backward).encodeBinary());
    ASSERT_EQ(PropertyList(0.0), PropertyList(-0.0));
    EXPECT_EQ(PropertyList(0.0).encodeBinary(), PropertyList(-0.0).encodeBinary());
}

TEST(PropertyList, keepsARealThatIsNoNumber) {
    const auto list = decoded(PropertyList(std::nan("1")).encodeBinary());
    ASSERT_TRUE(list && list->real());
    EXPECT_TRUE(std::isnan(*list->real()));
}

// --- Dates -----------------------------------------------------------------------------------------------------------

TEST(PropertyList, writesDatesAsSecondsSince2001) {
    EXPECT_EQ(encodedScalar(KsDate{.seconds = kSecondsFrom1970To2001}), "330000000000000000");
    EXPECT_EQ(encodedScalar(KsDate{.seconds = kSecondsFrom1970To2001 + 1, .nanoseconds = 500'000'000}),
              "333ff8000000000000");
    EXPECT_EQ(encodedScalar(KsDate{.seconds = kSecondsFrom1970To2001 - 1, .nanoseconds = 500'000'000}),
              "33bfe0000000000000");
}

TEST(PropertyList, keepsDatesToAnEighthOfAMicrosecondUntil2069) {
    std::mt19937_64 random(2);
    std::uniform_int_distribution<std::int64_t> seconds(0, 3'124'137'600);
    std::uniform_int_distribution<std::uint32_t> nanoseconds(0, 999'999'999);
    for (int i = 0; i < 20'000; ++i) {
        const KsDate date{.seconds = seconds(random), .nanoseconds = nanoseconds(random)};
        const auto list = decoded(PropertyList(date).encodeBinary());
        ASSERT_TRUE(list && list->date());
        const std::int64_t error =
            (list->date()->seconds - date.seconds) * 1'000'000'000 + list->date()->nanoseconds - date.nanoseconds;
        ASSERT_LE(std::abs(error), 120) << date.rfc3339();  // Half of 2^-22 s.
    }
}

// What was read once is written as what reads the same: no date creeps when its file is copied over and over.
TEST(PropertyList, readsEveryDateItWroteUnchanged) {
    std::mt19937_64 random(3);
    std::uniform_int_distribution<std::uint32_t> nanoseconds(0, 999'999'999);
    for (int bits = 0; bits < 63; ++bits) {
        for (int i = 0; i < 500; ++i) {
            const auto magnitude = static_cast<std::int64_t>(random() >> (63 - bits)) / 2;
            const KsDate date{.seconds = kSecondsFrom1970To2001 + (i % 2 ? magnitude : -magnitude),
                              .nanoseconds = nanoseconds(random)};
            const auto once = decoded(PropertyList(date).encodeBinary());
            ASSERT_TRUE(once && once->date());
            ASSERT_LT(once->date()->nanoseconds, 1'000'000'000U);
            ASSERT_EQ(decoded(once->encodeBinary()), once) << date.rfc3339();
        }
    }
}

TEST(PropertyList, roundsDatesToTheNearestNanosecond) {
    const auto read = [](const char* object) {
        const auto list = decodedObject(object);
        return list && list->date() ? *list->date() : KsDate{};
    };
    const KsDate epoch{.seconds = kSecondsFrom1970To2001};
    const KsDate before{.seconds = kSecondsFrom1970To2001 - 1, .nanoseconds = 999'999'999};
    EXPECT_EQ(read("333d70000000000000"), epoch);   // 2^-40 s
    EXPECT_EQ(read("33bd70000000000000"), epoch);   // -2^-40 s, which is all but a whole second after -1.
    EXPECT_EQ(read("33be112e0be826d695"), before);  // -1e-9 s
    EXPECT_EQ(read("333e112e0be826d695"), (KsDate{.seconds = kSecondsFrom1970To2001, .nanoseconds = 1}));
}

TEST(PropertyList, keepsWholeSecondsOfDatesExactly) {
    for (const std::int64_t seconds :
         {std::int64_t{0}, std::int64_t{-62'167'219'200}, std::int64_t{253'402'300'799}, std::int64_t{1} << 52}) {
        EXPECT_EQ(decoded(PropertyList(KsDate{.seconds = seconds}).encodeBinary()),
                  PropertyList(KsDate{.seconds = seconds}));
    }
}

TEST(PropertyList, writesDatesBeyondAllBoundsAsTheBound) {
    const auto last = decoded(
        PropertyList(KsDate{.seconds = std::numeric_limits<std::int64_t>::max(), .nanoseconds = 1}).encodeBinary());
    const auto first =
        decoded(PropertyList(KsDate{.seconds = std::numeric_limits<std::int64_t>::min()}).encodeBinary());
    ASSERT_TRUE(last && last->date() && first && first->date());
    EXPECT_GT(last->date()->seconds, std::numeric_limits<std::int64_t>::max() - 2'000'000'000);
    EXPECT_LT(first->date()->seconds, std::numeric_limits<std::int64_t>::min() + 2'000'000'000);
    EXPECT_EQ(decoded(last->encodeBinary()), last);
    EXPECT_EQ(decoded(first->encodeBinary()), first);
}

TEST(PropertyList, refusesDatesThatAreNone) {
    for (const char* object : {"337ff8000000000000", "337ff0000000000000", "33fff0000000000000", "3343e0000000000000",
                               "33c3e0000000000001"}) {
        EXPECT_EQ(refusalOfObject(object), "date out of range") << object;
    }
    EXPECT_TRUE(decodedObject("33c3e0000000000000"));
}

// --- Texts -----------------------------------------------------------------------------------------------------------

TEST(PropertyList, writesASCIIAsItIsAndTheRestAsUTF16) {
    EXPECT_EQ(encodedScalar("a\x7F"), "52617f");
    EXPECT_EQ(encodedScalar(std::string("\0", 1)), "5100");
    EXPECT_EQ(encodedScalar("ä"), "6100e4");
    EXPECT_EQ(encodedScalar("a€"), "62006120ac");
    EXPECT_EQ(encodedScalar("\xF0\x9F\x98\x80"), "62d83dde00");
    EXPECT_EQ(encodedScalar("\xF4\x8F\xBF\xBF"), "62dbffdfff");
}

// Too long a form, halves of pairs, beyond the last code point, bytes that begin nothing, sequences cut short.
TEST(PropertyList, keepsTextsThatAreNotUTF8) {
    EXPECT_EQ(encodedScalar("a\xFF"), "620061dcff");
    EXPECT_EQ(encodedScalar("\xED\xA0\x80"), "63dceddca0dc80");
    for (const std::string text : {"\x80",
                                   "\xFF",
                                   "\xC3",
                                   "\xC3(",
                                   "\xC0\xAF",
                                   "\xC1\xBF",
                                   "\xE0\x80\x80",
                                   "\xE0\x9F\xBF",
                                   "\xE2\x82",
                                   "\xE2\x82(",
                                   "\xED\xA0\x80",
                                   "\xED\xBF\xBF",
                                   "\xED\xA0\xBD\xED\xB8\x80",
                                   "\xED\xB2\x80",
                                   "\xF0\x80\x80\x80",
                                   "\xF0\x8F\xBF\xBF",
                                   "\xF0\x9F\x98",
                                   "\xF4\x90\x80\x80",
                                   "\xF5\x80\x80\x80",
                                   "\xF8\x88\x80\x80\x80",
                                   "ä\xA4",
                                   "\xC3\xC3\xA4",
                                   "\xF0\x9F\x98\x80\xF0\x9F\x98"}) {
        EXPECT_EQ(decoded(PropertyList(text).encodeBinary()), PropertyList(text)) << hexFromBytes(bytesOf(text));
        EXPECT_EQ(decoded(PropertyList(Dictionary{{text, true}}).encodeBinary()),
                  PropertyList(Dictionary{{text, true}}));
    }
}

TEST(PropertyList, keepsTextsOfAnyBytes) {
    std::mt19937 random(4);
    // Mostly bytes that begin or continue longer forms.
    constexpr std::string_view kBytes("a\x7F\x80\x8F\x90\x9F\xA0\xBF\xC2\xC3\xDF\xE0\xE2\xED\xEF\xF0\xF4\xF5\xFF\0",
                                      20);
    for (int i = 0; i < 50'000; ++i) {
        std::string text(random() % 8, ' ');
        for (char& c : text) c = kBytes[random() % kBytes.size()];
        ASSERT_EQ(decoded(PropertyList(text).encodeBinary()), PropertyList(text)) << hexFromBytes(bytesOf(text));
    }
}

TEST(PropertyList, keepsEveryCodePoint) {
    std::string text;
    std::size_t units = 0;
    for (std::uint32_t point = 0; point <= 0x10FFFF; ++point) {
        if (point >= 0xD800 && point <= 0xDFFF) continue;
        units += point < 0x10000 ? 1 : 2;
        if (point < 0x80) {
            text += static_cast<char>(point);
        } else if (point < 0x800) {
            text += {static_cast<char>(0xC0 | point >> 6), static_cast<char>(0x80 | (point & 0x3F))};
        } else if (point < 0x10000) {
            text += {static_cast<char>(0xE0 | point >> 12), static_cast<char>(0x80 | (point >> 6 & 0x3F)),
                     static_cast<char>(0x80 | (point & 0x3F))};
        } else {
            text += {static_cast<char>(0xF0 | point >> 18), static_cast<char>(0x80 | (point >> 12 & 0x3F)),
                     static_cast<char>(0x80 | (point >> 6 & 0x3F)), static_cast<char>(0x80 | (point & 0x3F))};
        }
    }
    const Bytes bytes = PropertyList(text).encodeBinary();
    EXPECT_EQ(bytes.size(), 8 + 6 + 2 * units + 4 + 32);  // Header; marker and length; text; one offset; trailer.
    EXPECT_TRUE(decoded(bytes) == PropertyList(text));
}

TEST(PropertyList, refusesTextsThatAreNone) {
    EXPECT_EQ(refusalOfObject("5180"), "text that is not ASCII where it must be");
    for (const char* object : {"61d800", "61dbff", "62d800e000", "62d800ffff", "62d8000000", "61dc00", "61dc7f",
                               "61dd00", "61dfff", "62d8000061", "62d800d800", "62dc00d800"}) {
        EXPECT_EQ(refusalOfObject(object), "text that is not UTF-16") << object;
    }
    EXPECT_EQ(decodedObject("61dc80"), PropertyList("\x80"));
    EXPECT_EQ(decodedObject("63dcffdbffdfff"), PropertyList("\xFF\xF4\x8F\xBF\xBF"));
}

// --- What others write -----------------------------------------------------------------------------------------------

TEST(PropertyList, readsIntegersOfEverySize) {
    EXPECT_EQ(decodedObject("1080"), number(0x80));
    EXPECT_EQ(decodedObject("118000"), number(0x8000));
    EXPECT_EQ(decodedObject("1280000000"), number(0x8000'0000));
    EXPECT_EQ(decodedObject("130000000000000007"), number(7));
    EXPECT_EQ(decodedObject("138000000000000000"), PropertyList(std::numeric_limits<std::int64_t>::min()));
    EXPECT_EQ(decodedObject("1400000000000000000000000000000007"), number(7));
    EXPECT_EQ(decodedObject("140000000000000000ffffffffffffffff"), number(0xFFFF'FFFF'FFFF'FFFF));
    EXPECT_EQ(decodedObject("14ffffffffffffffffffffffffffffffff"), negative(-1));
    EXPECT_EQ(decodedObject("14ffffffffffffffff8000000000000000"),
              PropertyList(std::numeric_limits<std::int64_t>::min()));
    for (const char* object : {"1400000000000000010000000000000000", "14ffffffffffffffff7fffffffffffffff",
                               "14fffffffffffffffe8000000000000000", "1480000000000000000000000000000000"}) {
        EXPECT_EQ(refusalOfObject(object), "integer of more than 64 bits") << object;
    }
    EXPECT_EQ(refusalOfObject("15" + std::string(64, '0')), "integer of an impossible size");
}

TEST(PropertyList, readsRealsOfBothSizes) {
    EXPECT_EQ(decodedObject("223fc00000"), PropertyList(1.5));
    EXPECT_EQ(decodedObject("233ff8000000000000"), PropertyList(1.5));
    for (const char* object : {"2000", "210000",
                               "24"
                               "00000000000000000000000000000000",
                               "3200000000", "3000",
                               "34"
                               "00000000000000000000000000000000"}) {
        EXPECT_EQ(refusalOfObject(object), "real or date of an impossible size") << object;
    }
}

TEST(PropertyList, readsAnyOrderOfObjectsAndKeys) {
    EXPECT_EQ(decoded(Forgery{.objects = {"1001", "5162",
                                          "d20301"
                                          "0200",
                                          "5161", "1002"},
                              .topObject = 2}),
              std::nullopt);  // The key "b" has the value "d2…" itself: a cycle.
    EXPECT_EQ(decoded(Forgery{.objects = {"1001", "5162",
                                          "d20103"
                                          "0400",
                                          "5161", "1002"},
                              .topObject = 2}),
              PropertyList(Dictionary{{"b", number(2)}, {"a", number(1)}}));
}

TEST(PropertyList, readsOffsetsAndReferencesOfAnySize) {
    for (std::size_t size = 1; size <= 8; ++size) {
        EXPECT_EQ(
            decoded(Forgery{.objects = {"a1" + bigEndian(1, size), "09"}, .offsetSize = size, .referenceSize = size}),
            PropertyList(Array{true}))
            << size;
    }
}

TEST(PropertyList, readsLengthsOfAnySize) {
    for (const char* length : {"1001", "110001", "1200000001", "130000000000000001"}) {
        EXPECT_EQ(decodedObject(std::string("5f") + length + "61"), PropertyList("a")) << length;
    }
}

TEST(PropertyList, readsSharedObjectsOncePerReference) {
    EXPECT_EQ(decoded(Forgery{.objects = {"a3010101", "a20202", "5161"}}), PropertyList(Array(3, Array(2, "a"))));
}

TEST(PropertyList, passesOverObjectsThatNothingRefersTo) {
    EXPECT_EQ(decoded(Forgery{.objects = {"09", "ff"}}), PropertyList(true));
}

TEST(PropertyList, refusesKindsThatItHasNoValueFor) {
    // Null, fill, URLs, a UUID, a UID, UTF-8, sets.
    for (const char* object : {"00", "0f", "0c", "0d", "0e", "01", "07", "8000", "830000000000000001", "7161", "b0",
                               "c0", "90", "e0", "f0"}) {
        EXPECT_EQ(refusalOfObject(object), "object of an unknown kind") << object;
    }
}

TEST(PropertyList, refusesTwoValuesForOneKey) {
    EXPECT_EQ(refusal(Forgery{.objects = {"d201010202", "5161", "09"}}), "two values for one key");
    EXPECT_EQ(refusal(Forgery{.objects = {"d201020303", "5161", "610061", "09"}}), "two values for one key");
}

TEST(PropertyList, refusesKeysThatAreNoTexts) {
    EXPECT_EQ(refusal(Forgery{.objects = {"d10102", "1001", "09"}}), "key that is no text");
    EXPECT_EQ(refusal(Forgery{.objects = {"d10101", "a0"}}), "key that is no text");
}

// --- What is malformed -----------------------------------------------------------------------------------------------

TEST(PropertyList, refusesOtherHeaders) {
    for (const char* header : {"bplist01", "bplist0", "BPLIST00", "<?xml ve", "bplist15"}) {
        EXPECT_NE(refusal(Forgery{.objects = {"09"}, .header = header}), "") << header;
    }
    EXPECT_FALSE(decoded(Bytes{}));
    EXPECT_FALSE(decoded(Bytes(40)));
}

TEST(PropertyList, refusesObjectsOutsideOfTheObjects) {
    ASSERT_EQ(decoded(Forgery{.objects = {"09"}, .offsets = {8}}), PropertyList(true));
    for (const std::uint64_t offset : {0, 7, 9, 10, 40, 41, 42, 255}) {
        EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .offsets = {offset}}), "object outside of the objects") << offset;
    }
    for (const std::uint64_t offset : {std::uint64_t{1} << 63, ~std::uint64_t{0}, ~std::uint64_t{0} - 7}) {
        EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .offsets = {offset}, .offsetSize = 8}),
                  "object outside of the objects")
            << offset;
    }
    // Also when nothing refers to it.
    EXPECT_EQ(refusal(Forgery{.objects = {"09", "08"}, .offsets = {8, 200}}), "object outside of the objects");
}

TEST(PropertyList, refusesReferencesToNoObject) {
    for (const char* object : {"a101", "a102", "a1ff", "d10101", "d101ff"}) {
        EXPECT_NE(refusalOfObject(object), "") << object;
    }
    EXPECT_EQ(refusalOfObject("a1ff"), "reference to no object");
    EXPECT_EQ(refusal(Forgery{.objects = {"a1ffffffffffffffff"}, .referenceSize = 8}), "reference to no object");
}

TEST(PropertyList, refusesImpossibleSizesInTheTrailer) {
    for (const std::uint64_t size : {0, 9, 16, 255}) {
        EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .statedOffsetSize = size}), "offsets of an impossible size")
            << size;
        EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .referenceSize = size}), "references of an impossible size")
            << size;
    }
    EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .statedOffsetSize = 2}), "offset table of another size");
    EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .unused = "000000000001"}), "unknown fields in the trailer");
}

TEST(PropertyList, refusesCountsThatAreNotThere) {
    for (const std::uint64_t count :
         {std::uint64_t{2}, std::uint64_t{256}, std::uint64_t{1} << 32, std::uint64_t{1} << 61, ~std::uint64_t{0}}) {
        EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .objectCount = count}), "offset table of another size") << count;
    }
    // So many that counting their bytes in 64 bits comes out right again.
    EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .offsetSize = 8, .objectCount = (std::uint64_t{1} << 61) + 1}),
              "offset table of another size");
    EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .objectCount = 0}), "no top object");
    EXPECT_EQ(refusal(Forgery{.objects = {}}), "no top object");
}

TEST(PropertyList, refusesATopObjectOutOfRange) {
    for (const std::uint64_t top : {std::uint64_t{1}, std::uint64_t{255}, ~std::uint64_t{0}}) {
        EXPECT_EQ(refusal(Forgery{.objects = {"09"}, .topObject = top}), "no top object") << top;
    }
}

TEST(PropertyList, refusesATableElsewhere) {
    ASSERT_EQ(decoded(Forgery{.objects = {"09"}, .table = 9}), PropertyList(true));
    for (const std::uint64_t table : {std::uint64_t{0}, std::uint64_t{7}, std::uint64_t{8}, std::uint64_t{10},
                                      std::uint64_t{42}, std::uint64_t{1} << 63, ~std::uint64_t{0}}) {
        EXPECT_NE(refusal(Forgery{.objects = {"09"}, .table = table}), "") << table;
    }
}

TEST(PropertyList, refusesLengthsBeyondTheEnd) {
    for (const std::string kind : {"4", "5", "6", "a", "d"}) {
        for (const std::string length : {"1", "f10ff", "f11ffff", "f12ffffffff", "f137fffffffffffffff",
                                         "f138000000000000000", "f13ffffffffffffffff", "f13fffffffffffffff0"}) {
            EXPECT_EQ(refusalOfObject(kind + length), "object cut short") << kind << length;
        }
        for (const std::string length :
             {"f", "f140000000000000000000000000000000000", "f0f", "f2300000000", "f5161", "fff"}) {
            EXPECT_EQ(refusalOfObject(kind + length), "no length where one must be") << kind << length;
        }
        for (const std::string length : {"f10", "f1100", "f12000000", "f1300000000000000"}) {
            EXPECT_EQ(refusalOfObject(kind + length), "object cut short") << kind << length;
        }
    }
    for (const char* object : {"10", "1100", "12000000", "1300000000000000", "14000000000000000000000000000000",
                               "22000000", "2300000000000000", "3300000000000000"}) {
        EXPECT_EQ(refusalOfObject(object), "object cut short") << object;
    }
}

// The bytes after the last object are the table's, whatever they would mean.
TEST(PropertyList, refusesObjectsThatReachIntoTheTable) {
    EXPECT_EQ(refusalOfObject("51"), "object cut short");
    EXPECT_EQ(refusal(Forgery{.objects = {"a10109", "a1"}, .offsets = {8, 11}}), "object cut short");
}

TEST(PropertyList, refusesCycles) {
    EXPECT_EQ(refusalOfObject("a100"), "nested too deep");
    EXPECT_EQ(refusalOfObject("a20000"), "nested too deep");
    EXPECT_EQ(refusal(Forgery{.objects = {"a101", "a102", "a101"}}), "nested too deep");
    EXPECT_EQ(refusal(Forgery{.objects = {"d10100", "5161"}}), "nested too deep");
}

TEST(PropertyList, readsAsManyLevelsAsItWrites) {
    const PropertyList deepest = nested(kPropertyListDepthMax);
    const Bytes bytes = deepest.encodeBinary();
    EXPECT_EQ(decoded(bytes), deepest);

    // The same with one level more, by hand.
    Forgery deeper;
    for (unsigned i = 1; i <= kPropertyListDepthMax; ++i) deeper.objects.push_back("a1" + bigEndian(i, 2));
    deeper.objects.emplace_back("a0");
    deeper.offsetSize = 2;
    deeper.referenceSize = 2;
    EXPECT_EQ(refusal(deeper), "nested too deep");
    deeper.objects[1] = "a0";
    EXPECT_EQ(decoded(deeper), PropertyList(Array(1, Array{})));
}

TEST(PropertyListDeathTest, neverWritesMoreLevelsThanItReads) {
    EXPECT_DEATH(nested(kPropertyListDepthMax + 1).encodeBinary(), "a property list has too many levels to be encoded");
}

// Thirty levels of arrays that each refer twice, or fifty times, to the next.
TEST(PropertyList, refusesWhatUnfoldsWithoutEnd) {
    for (const unsigned width : {2U, 14U, 50U}) {
        Forgery laughs;
        for (unsigned level = 1; level <= 30; ++level) {
            std::string array = width < 15 ? "a" + bigEndian(width, 1).substr(1) : "af10" + bigEndian(width, 1);
            for (unsigned i = 0; i < width; ++i) array += bigEndian(level, 1);
            laughs.objects.push_back(array);
        }
        laughs.objects.emplace_back(
            "5568616861"
            "21");
        laughs.offsetSize = 2;
        EXPECT_EQ(refusal(laughs), "more values than the file has room for") << width;
    }
}

TEST(PropertyList, refusesWhatUnfoldsWithoutEndInDictionaries) {
    Forgery laughs;
    for (unsigned level = 0; level < 40; ++level)
        laughs.objects.push_back("d22829" + bigEndian(level + 1, 1) + bigEndian(level + 1, 1));
    laughs.objects[39] = "a0";
    laughs.objects.insert(laughs.objects.end(), {"5161", "5162"});
    EXPECT_EQ(refusal(laughs), "more values than the file has room for");
}

// One large text, referred to from everywhere.
TEST(PropertyList, refusesTextsThatUnfoldWithoutEnd) {
    const auto textSharedBy = [](unsigned count, const std::string& text) {
        std::string array = "af11" + bigEndian(count, 2);
        for (unsigned i = 0; i < count; ++i) array += "01";
        return Forgery{.objects = {array, text}, .offsetSize = 4};
    };
    const std::string text = "5f12" + bigEndian(100'000, 4) + hexFromBytes(bytesOf(std::string(100'000, 'a')));
    const std::string wideText = "6f12" + bigEndian(50'000, 4) + hexFromBytes(Bytes(100'000));
    const std::string data = "4f12" + bigEndian(100'000, 4) + hexFromBytes(Bytes(100'000));
    for (const std::string& object : {text, wideText, data}) {
        EXPECT_EQ(refusal(textSharedBy(10'000, object)), "more values than the file has room for");
        EXPECT_EQ(refusal(textSharedBy(10, object)), "");
    }
}

// Arrays that lie within each other's references: each is small, all together are as large as the square of the file.
TEST(PropertyList, refusesOverlappingArraysThatUnfoldToMuch) {
    constexpr unsigned kCount = 4'000;
    Forgery forgery;
    std::string references;
    for (unsigned i = 0; i < kCount; ++i) references += bigEndian(1, 2);
    forgery.objects = {"af11" + bigEndian(kCount, 2) + references,
                       "af11" + bigEndian(kCount, 2) + references + bigEndian(2, 2), "09"};
    forgery.referenceSize = 2;
    forgery.offsetSize = 4;
    for (std::size_t i = 4; i < forgery.objects[1].size(); i += 4) forgery.objects[1].replace(i, 4, bigEndian(2, 2));
    forgery.objects[1].replace(0, 8, "af11" + bigEndian(kCount, 2));
    EXPECT_EQ(refusal(forgery), "more values than the file has room for");
}

// A list as large as they come from us is far from the limit on what one may unfold to.
TEST(PropertyList, readsWhatItWroteWhateverItsSize) {
    Array texts;
    for (int i = 0; i < 100'000; ++i) texts.emplace_back("\xE6\xBC\xA2\xE5\xAD\x97");
    const PropertyList list =
        Dictionary{{"data", Bytes(1'000'000)}, {"texts", texts}, {"wide", std::string(300'000, '\xFF')}};
    EXPECT_TRUE(decoded(list.encodeBinary()) == list);
}

// A list cut short at any byte is none.
TEST(PropertyList, refusesEveryTruncation) {
    for (const Golden& golden : goldens()) {
        const Bytes bytes = bytesFromHex(golden.hex);
        for (std::size_t size = 0; size < bytes.size(); ++size)
            EXPECT_FALSE(decoded(ByteView(bytes).first(size))) << size;
    }
}

TEST(PropertyList, refusesBytesAfterTheEnd) {
    Bytes bytes = everyType().encodeBinary();
    bytes.push_back(std::byte{0});
    EXPECT_FALSE(decoded(bytes));
}

// One bit turned round gives no list, or another one that is as good as any.
TEST(PropertyList, survivesEveryFlippedBit) {
    std::size_t refused = 0;
    for (const Golden& golden : goldens()) {
        const Bytes bytes = bytesFromHex(golden.hex);
        for (std::size_t bit = 0; bit < bytes.size() * 8; ++bit) {
            Bytes flipped = bytes;
            flipped[bit / 8] ^= std::byte{1} << bit % 8;
            const auto list = decoded(flipped);
            if (!list) {
                ++refused;
                continue;
            }
            const Bytes written = list->encodeBinary();
            const auto again = decoded(written);
            ASSERT_TRUE(again) << bit;
            ASSERT_EQ(again->encodeBinary(), written) << bit;
        }
    }
    EXPECT_GT(refused, 0U);
}

}  // namespace
}  // namespace cindral
