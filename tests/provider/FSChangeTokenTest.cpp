#include "provider/fs/FSChangeToken.h"

#include <gtest/gtest.h>

#include <limits>

#include "platform/foundation/PropertyList.h"
#include "support/Hex.h"
#include "support/LogCapture.h"

namespace cindral {
namespace {

using test::bytesFromHex;
using test::hexFromBytes;

constexpr std::uint64_t kMost = std::numeric_limits<std::uint64_t>::max();
constexpr KsUUID kVolume{
    {0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0x4D, 0xEF, 0xBE, 0xDC, 0xBA, 0x98, 0x76, 0x54, 0x32, 0x10}};
constexpr std::string_view kVolumeText = "01234567-89AB-4DEF-BEDC-BA9876543210";

FSChangeToken page() {
    return {.deviceUUID = kVolume, .streamEventID = 1'234'567, .offset = 200, .appLibraryVersionToken = 3};
}

FSChangeToken largest() {
    return {.deviceUUID = kVolume, .streamEventID = kMost, .offset = kMost, .appLibraryVersionToken = kMost};
}

PropertyList::Dictionary fieldsOfAPage() {
    return {
        {"version", std::uint64_t{1}},
        {"deviceUUID", std::string(kVolumeText)},
        {"streamEventID", std::uint64_t{1'234'567}},
        {"offset", std::uint64_t{200}},
        {"appLibraryVersionToken", std::uint64_t{3}},
    };
}

Bytes pageWith(const std::string& key, PropertyList value) {
    PropertyList::Dictionary fields = fieldsOfAPage();
    fields.insert_or_assign(key, std::move(value));
    return PropertyList(std::move(fields)).encodeBinary();
}

Bytes pageWithout(const std::string& key) {
    PropertyList::Dictionary fields = fieldsOfAPage();
    fields.erase(key);
    return PropertyList(std::move(fields)).encodeBinary();
}

/// That the bytes are no token, and that one error line says so.
void expectNone(ByteView bytes, const std::string& reason) {
    const test::LogCapture log;
    EXPECT_FALSE(FSChangeToken::decode(bytes)) << reason;
    const std::string line =
        "[ERROR] can't decode token from provided data; Invalid argument (KsPOSIXErrorDomain 22): " + reason;
    ASSERT_EQ(log.lines().size(), 1U) << reason;
    EXPECT_EQ(log.lines().front(), (test::LogCapture::Line{LogLevel::error, line}));
}

struct Golden {
    FSChangeToken token;
    std::string_view hex;
};

// Clients keep these bytes for as long as they like. Never change one; a new version is a new row.
std::vector<Golden> goldens() {
    return {
        {page(),
         "62706c6973743030"
         "d50102030405060708090a5f10166170704c69627261727956657273696f6e546f6b656e5a6465766963655555494456"
         "6f66667365745d73747265616d4576656e7449445776657273696f6e10035f102430313233343536372d383941422d34"
         "4445462d424544432d42413938373635343332313010c8120012d687100108132c373e4c54567d7f84"
         "0000000000000101000000000000000b00000000000000000000000000000086"},
        {largest(),
         "62706c6973743030"
         "d50102030405060708090a5f10166170704c69627261727956657273696f6e546f6b656e5a6465766963655555494456"
         "6f66667365745d73747265616d4576656e7449445776657273696f6e140000000000000000ffffffffffffffff5f1024"
         "30313233343536372d383941422d344445462d424544432d424139383736353433323130140000000000000000ffffff"
         "ffffffffff140000000000000000ffffffffffffffff100108132c373e4c54658c9dae"
         "0000000000000101000000000000000b000000000000000000000000000000b0"},
        {FSChangeToken{},
         "62706c6973743030"
         "d50102030405060708090a5f10166170704c69627261727956657273696f6e546f6b656e5a6465766963655555494456"
         "6f66667365745d73747265616d4576656e7449445776657273696f6e10005f102430303030303030302d303030302d30"
         "3030302d303030302d30303030303030303030303010001000100108132c373e4c54567d7f81"
         "0000000000000101000000000000000b00000000000000000000000000000083"},
    };
}

TEST(FSChangeToken, writesTheGoldenBytes) {
    for (const Golden& golden : goldens())
        EXPECT_EQ(hexFromBytes(golden.token.encode()), hexFromBytes(bytesFromHex(golden.hex)));
}

TEST(FSChangeToken, readsTheGoldenBytes) {
    for (const Golden& golden : goldens())
        EXPECT_EQ(FSChangeToken::decode(bytesFromHex(golden.hex)), golden.token) << golden.hex;
}

TEST(FSChangeToken, decodesWhatItEncoded) {
    const test::LogCapture log;
    for (const FSChangeToken& token :
         {page(), largest(), FSChangeToken{}, FSChangeToken{.deviceUUID = KsUUID::random()}}) {
        EXPECT_EQ(FSChangeToken::decode(token.encode()), token) << token.description();
    }
    EXPECT_TRUE(log.lines().empty());
}

TEST(FSChangeToken, isAPropertyListOfItsFields) {
    const auto list = PropertyList::decodeBinary(page().encode());
    ASSERT_TRUE(list);
    EXPECT_EQ(*list, PropertyList(fieldsOfAPage()));
}

TEST(FSChangeToken, saysThatItIsAFollowers) {
    FSChangeToken token;
    const Bytes plain = token.encode();
    token.isForFollower = true;
    EXPECT_EQ(FSChangeToken::decode(token.encode()), token);
    EXPECT_NE(token.encode(), plain);
    EXPECT_FALSE(FSChangeToken::decode(plain)->isForFollower);
}

TEST(FSChangeToken, equalTokensHaveEqualBytes) {
    EXPECT_EQ(page().encode(), page().encode());
    EXPECT_EQ(FSChangeToken::decode(page().encode())->encode(), page().encode());
}

TEST(FSChangeToken, differsInEveryField) {
    const auto changedBy = [](auto change) {
        FSChangeToken token = page();
        change(token);
        EXPECT_NE(token, page());
        EXPECT_NE(token.encode(), page().encode());
        EXPECT_NE(token.description(), page().description());
        return token;
    };
    changedBy([](FSChangeToken& token) { token.version = 2; });
    EXPECT_EQ(FSChangeToken::decode(changedBy([](FSChangeToken& token) { token.deviceUUID.bytes[15] = 0; }).encode())
                  ->deviceUUID.bytes[15],
              0);
    EXPECT_EQ(
        FSChangeToken::decode(changedBy([](FSChangeToken& token) { token.streamEventID = 1; }).encode())->streamEventID,
        1U);
    EXPECT_EQ(FSChangeToken::decode(changedBy([](FSChangeToken& token) { token.offset = 0; }).encode())->offset, 0U);
    EXPECT_EQ(FSChangeToken::decode(changedBy([](FSChangeToken& token) { token.appLibraryVersionToken = 0; }).encode())
                  ->appLibraryVersionToken,
              0U);
}

TEST(FSChangeToken, describesItself) {
    EXPECT_EQ(page().description(),
              "<FSChangeToken version: 1, deviceUUID: 01234567-89AB-4DEF-BEDC-BA9876543210, streamEventID: 1234567, "
              "offset: 200, "
              "appLibraryVersionToken: 3>");
}

TEST(FSChangeToken, rejectsATokenThatLacksAField) {
    for (const std::string key : {"version", "deviceUUID", "streamEventID", "offset", "appLibraryVersionToken"}) {
        expectNone(pageWithout(key), "no value for \"" + key + "\"");
    }
}

TEST(FSChangeToken, rejectsValuesOfOtherTypes) {
    const auto uuid = std::string(kVolumeText);
    for (const std::string key : {"version", "streamEventID", "offset", "appLibraryVersionToken"}) {
        for (const PropertyList& value :
             {PropertyList(true), PropertyList(1.0), PropertyList(std::int64_t{-1}), PropertyList("1"),
              PropertyList(KsDate{}), PropertyList(Bytes{}), PropertyList(PropertyList::Array{}),
              PropertyList(PropertyList::Dictionary{})}) {
            expectNone(pageWith(key, value), "no unsigned integer for \"" + key + "\"");
        }
    }
    for (const PropertyList& value :
         {PropertyList(""), PropertyList(uuid + "0"), PropertyList(uuid.substr(1)),
          PropertyList("0123456789AB4DEFBEDCBA9876543210"), PropertyList(Bytes(kVolume.bytes.size())),
          PropertyList(std::uint64_t{1}), PropertyList(PropertyList::Array{uuid})}) {
        expectNone(pageWith("deviceUUID", value), "no UUID for \"deviceUUID\"");
    }
}

TEST(FSChangeToken, readsEveryVersion) {
    for (const std::uint64_t version : {std::uint64_t{0}, std::uint64_t{2}, kMost}) {
        FSChangeToken token = page();
        token.version = version;
        EXPECT_EQ(FSChangeToken::decode(token.encode()), token);
    }
}

// Nothing is lost at the far end of any field.
TEST(FSChangeToken, decodesWhatItEncodedAtItsMost) {
    FSChangeToken token = page();
    token.version = token.streamEventID = token.offset = token.appLibraryVersionToken = kMost;
    EXPECT_EQ(FSChangeToken::decode(token.encode()), token);
}

TEST(FSChangeToken, rejectsWhatIsNoDictionary) {
    expectNone(PropertyList(std::string(kVolumeText)).encodeBinary(), "no value for \"version\"");
    expectNone(PropertyList(PropertyList::Array{std::uint64_t{1}}).encodeBinary(), "no value for \"version\"");
}

TEST(FSChangeToken, rejectsWhatIsNoPropertyList) {
    expectNone({}, "too short for a property list");
    expectNone(bytesOf("TesselInitialPageSortedByName"), "too short for a property list");
    expectNone(Bytes(200), "not a binary property list");
}

TEST(FSChangeToken, rejectsMoreBytesThanATokenCanHave) {
    const auto pageOfSize = [](std::size_t size) {
        const Bytes bytes = pageWith("more", Bytes(256));
        return pageWith("more", Bytes(256 + size - bytes.size()));
    };
    ASSERT_LE(pageOfSize(FSChangeToken::kEncodedSizeMax - 100).size(), FSChangeToken::kEncodedSizeMax);
    EXPECT_EQ(FSChangeToken::decode(pageOfSize(FSChangeToken::kEncodedSizeMax - 100)), page());
    expectNone(pageOfSize(FSChangeToken::kEncodedSizeMax + 100), "too large for a token");
    expectNone(Bytes(10'000'000), "too large for a token");
}

TEST(FSChangeToken, readsAnUnknownFieldAsNothing) {
    EXPECT_EQ(FSChangeToken::decode(pageWith("colour", "red")), page());
}

TEST(FSChangeToken, readsAUUIDOfEitherCase) {
    EXPECT_EQ(FSChangeToken::decode(pageWith("deviceUUID", "01234567-89ab-4def-bedc-ba9876543210")), page());
}

// A token cut short at any byte is none, never a crash and never another token.
TEST(FSChangeToken, rejectsEveryTruncation) {
    for (const Golden& golden : goldens()) {
        const Bytes bytes = bytesFromHex(golden.hex);
        for (std::size_t size = 0; size < bytes.size(); ++size)
            EXPECT_FALSE(FSChangeToken::decode(ByteView(bytes).first(size))) << size;
    }
}

// One bit turned round gives none, or a token that encodes and decodes again.
TEST(FSChangeToken, survivesEveryFlippedBit) {
    for (const Golden& golden : goldens()) {
        const Bytes bytes = bytesFromHex(golden.hex);
        std::size_t rejected = 0;
        for (std::size_t bit = 0; bit < bytes.size() * 8; ++bit) {
            Bytes flipped = bytes;
            flipped[bit / 8] ^= std::byte{1} << bit % 8;
            const auto token = FSChangeToken::decode(flipped);
            if (!token) {
                ++rejected;
                continue;
            }
            EXPECT_EQ(FSChangeToken::decode(token->encode()), token) << bit;
        }
        // Only the values themselves can change: 36 digits of the UUID, and the integers.
        EXPECT_GT(rejected, bytes.size() * 8 / 2);
    }
}

}  // namespace
}  // namespace cindral
