#include "platform/foundation/KeyedArchive.h"

#include <gtest/gtest.h>

#include <limits>

#include "support/Hex.h"

namespace cindral {
namespace {

using Array = PropertyList::Array;
using Dictionary = PropertyList::Dictionary;
using namespace keyed_archive;  // NOLINT(google-build-using-namespace)
using test::bytesFromHex;
using test::hexFromBytes;

PropertyList plistNumber(std::uint64_t value) {
    return value;
}

/// The dictionary at the top of an archive of "text", with one entry replaced or added.
Bytes archiveWith(const char* key, PropertyList value) {
    Dictionary top{{"archiver", "KsKeyedArchiver"}, {"version", plistNumber(1)}, {"root", "text"}};
    top.insert_or_assign(key, std::move(value));
    return PropertyList(std::move(top)).encodeBinary();
}

Bytes archiveWithout(const char* key) {
    Dictionary top{{"archiver", "KsKeyedArchiver"}, {"version", plistNumber(1)}, {"root", "text"}};
    top.erase(key);
    return PropertyList(std::move(top)).encodeBinary();
}

// Attributes of the users' files hold these bytes. Never change one; a new form is a new one.
constexpr std::string_view kGoldenString =
    "62706c6973743030 d3010203040506 "
    "58617263686976657254726f6f745776657273696f6e5f100f4b734b65796564417263686976657254746578741001"
    "080f181d25373c 000000000000010100000000000000070000000000000000000000000000003e";

TEST(KeyedArchive, writesTheGoldenBytes) {
    EXPECT_EQ(hexFromBytes(archive("text")), hexFromBytes(bytesFromHex(kGoldenString)));
}

TEST(KeyedArchive, readsTheGoldenBytes) {
    EXPECT_EQ(unarchiveString(bytesFromHex(kGoldenString)), "text");
}

TEST(KeyedArchive, isAPropertyListThatSaysWhatItIs) {
    EXPECT_EQ(archive("text"), archiveWith("root", "text"));
}

TEST(KeyedArchive, unarchivesWhatItArchived) {
    const KsDate date{.seconds = 1'795'168'320, .nanoseconds = 500'000'000};
    EXPECT_EQ(unarchiveDate(archive(date)), date);
    EXPECT_EQ(unarchiveString(archive("Documents/\xFF.txt")), "Documents/\xFF.txt");
    EXPECT_EQ(unarchiveString(archive("")), "");
    EXPECT_EQ(unarchiveStrings(archive(Array{"red", "grün", "red"})), (std::vector<std::string>{"red", "grün", "red"}));
    EXPECT_EQ(unarchiveStrings(archive(Array{})), std::vector<std::string>{});
    const PropertyList object = Dictionary{{"class", "RoBundleProxy"}, {"bundleIdentifier", "org.example.editor"}};
    EXPECT_EQ(unarchiveRoot(archive(Array{object, object})), PropertyList(Array{object, object}));
}

TEST(KeyedArchive, unarchivesIntegersExactly) {
    for (const std::int64_t value :
         {std::int64_t{0}, std::int64_t{1}, std::int64_t{-1}, (std::int64_t{1} << 53) + 1,
          std::numeric_limits<std::int64_t>::max(), std::numeric_limits<std::int64_t>::min()}) {
        EXPECT_EQ(unarchiveInteger(archive(value)), value);
    }
}

TEST(KeyedArchive, unarchivesWholeRealsThatFitAsIntegers) {
    EXPECT_EQ(unarchiveInteger(archive(7.0)), 7);
    EXPECT_EQ(unarchiveInteger(archive(-0.0)), 0);
    EXPECT_EQ(unarchiveInteger(archive(-0x1p63)), std::numeric_limits<std::int64_t>::min());
    for (const double real : {0.5, 0x1p63, -0x1.0000000000001p63, 1e300, std::numeric_limits<double>::infinity(),
                              -std::numeric_limits<double>::infinity(), std::numeric_limits<double>::quiet_NaN()}) {
        EXPECT_FALSE(unarchiveInteger(archive(real))) << real;
    }
}

TEST(KeyedArchive, hasNoIntegerBeyondSigned64Bits) {
    EXPECT_FALSE(unarchiveInteger(archive(std::uint64_t{1} << 63)));
    EXPECT_FALSE(unarchiveInteger(archive(std::numeric_limits<std::uint64_t>::max())));
    EXPECT_EQ(unarchiveRoot(archive(std::numeric_limits<std::uint64_t>::max())),
              PropertyList(std::numeric_limits<std::uint64_t>::max()));
}

TEST(KeyedArchive, refusesEveryOtherClass) {
    const KsDate date{.seconds = 1};
    for (const PropertyList& root : {PropertyList(true), plistNumber(1), PropertyList(std::int64_t{-1}),
                                     PropertyList(1.0), PropertyList(date), PropertyList(Bytes{}), PropertyList("1"),
                                     PropertyList(Array{"1"}), PropertyList(Dictionary{{"class", "1"}})}) {
        const Bytes bytes = archive(root);
        EXPECT_EQ(unarchiveRoot(bytes), root);
        EXPECT_EQ(unarchiveDate(bytes).has_value(), root.date() != nullptr);
        EXPECT_EQ(unarchiveString(bytes).has_value(), root.string() != nullptr);
        EXPECT_EQ(unarchiveStrings(bytes).has_value(), root.array() != nullptr);
        EXPECT_EQ(unarchiveInteger(bytes).has_value(), root.unsignedInteger() || root.negativeInteger() || root.real());
    }
    EXPECT_FALSE(unarchiveStrings(archive(Array{"red", plistNumber(1)})));
    EXPECT_FALSE(unarchiveStrings(archive(Array{"red", Array{}})));
}

TEST(KeyedArchive, refusesAnotherArchiverOrVersion) {
    ASSERT_TRUE(unarchiveRoot(archiveWith("root", "text")));
    EXPECT_FALSE(unarchiveRoot(archiveWith("archiver", "OtherArchiver")));
    EXPECT_FALSE(unarchiveRoot(archiveWith("archiver", plistNumber(1))));
    EXPECT_FALSE(unarchiveRoot(archiveWith("version", plistNumber(2))));
    EXPECT_FALSE(unarchiveRoot(archiveWith("version", plistNumber(0))));
    EXPECT_FALSE(unarchiveRoot(archiveWith("version", 1.0)));
    EXPECT_FALSE(unarchiveRoot(archiveWith("version", true)));
    EXPECT_FALSE(unarchiveRoot(archiveWith("version", "1")));
    EXPECT_FALSE(unarchiveRoot(archiveWith("more", "text")));
    for (const char* key : {"archiver", "version", "root"}) EXPECT_FALSE(unarchiveRoot(archiveWithout(key))) << key;
}

TEST(KeyedArchive, refusesWhatIsNoArchive) {
    EXPECT_FALSE(unarchiveRoot({}));
    EXPECT_FALSE(unarchiveRoot(bytesOf("text")));
    EXPECT_FALSE(unarchiveRoot(PropertyList("text").encodeBinary()));
    EXPECT_FALSE(unarchiveRoot(PropertyList(Array{"archiver", "KsKeyedArchiver"}).encodeBinary()));
    EXPECT_FALSE(unarchiveDate({}));
    EXPECT_FALSE(unarchiveString({}));
    EXPECT_FALSE(unarchiveStrings({}));
    EXPECT_FALSE(unarchiveInteger({}));
}

TEST(KeyedArchive, refusesEveryTruncation) {
    const Bytes bytes = bytesFromHex(kGoldenString);
    for (std::size_t size = 0; size < bytes.size(); ++size)
        EXPECT_FALSE(unarchiveRoot(ByteView(bytes).first(size))) << size;
}

// One bit turned round gives no archive, or one of a value that can be archived as well.
TEST(KeyedArchive, survivesEveryFlippedBit) {
    const Bytes bytes = bytesFromHex(kGoldenString);
    std::size_t refused = 0;
    for (std::size_t bit = 0; bit < bytes.size() * 8; ++bit) {
        Bytes flipped = bytes;
        flipped[bit / 8] ^= std::byte{1} << bit % 8;
        const auto root = unarchiveRoot(flipped);
        if (root) {
            ASSERT_EQ(unarchiveRoot(archive(*root)), root) << bit;
        } else {
            ++refused;
        }
    }
    EXPECT_GT(refused, bytes.size() * 7);
}

}  // namespace
}  // namespace cindral
