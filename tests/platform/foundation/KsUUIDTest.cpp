#include "platform/foundation/KsUUID.h"

#include <gtest/gtest.h>

#include <set>

namespace cindral {
namespace {

constexpr KsUUID kExample{
    {0x01, 0x23, 0x45, 0x67, 0x89, 0xAB, 0xCD, 0xEF, 0xFE, 0xDC, 0xBA, 0x98, 0x76, 0x54, 0x32, 0x10}};

TEST(KsUUID, writesTheCanonicalFormInCapitals) {
    EXPECT_EQ(kExample.string(), "01234567-89AB-CDEF-FEDC-BA9876543210");
    EXPECT_EQ(KsUUID{}.string(), "00000000-0000-0000-0000-000000000000");
}

TEST(KsUUID, parsesEitherCase) {
    EXPECT_EQ(KsUUID::parse("01234567-89AB-CDEF-FEDC-BA9876543210"), kExample);
    EXPECT_EQ(KsUUID::parse("01234567-89ab-cdef-fedc-ba9876543210"), kExample);
    EXPECT_EQ(KsUUID::parse("01234567-89aB-CdEf-FeDc-bA9876543210"), kExample);
}

TEST(KsUUID, refusesAnyCharacterOutOfPlace) {
    const std::string good = kExample.string();
    for (std::size_t i = 0; i < good.size(); ++i) {
        for (const char c : {'g', 'G', '-', '/', ':', '@', '`', ' ', '\0', '0'}) {
            std::string text = good;
            text[i] = c;
            const bool isDigit = c == '0';
            EXPECT_EQ(KsUUID::parse(text).has_value(), (good[i] == '-') == (c == '-') && (c == '-' || isDigit)) << text;
        }
    }
}

TEST(KsUUID, refusesOtherLengthsAndForms) {
    const std::string good = kExample.string();
    for (std::size_t length = 0; length < good.size(); ++length)
        EXPECT_FALSE(KsUUID::parse(good.substr(0, length))) << length;
    EXPECT_FALSE(KsUUID::parse(good + "0"));
    EXPECT_FALSE(KsUUID::parse("0123456789ABCDEFFEDCBA9876543210"));
    EXPECT_FALSE(KsUUID::parse("{" + good + "}"));
    EXPECT_FALSE(KsUUID::parse("0123-456789AB-CDEF-FEDC-BA9876543210"));
}

TEST(KsUUID, randomOnesAreOfVersion4AndDiffer) {
    std::set<KsUUID> seen;
    for (int i = 0; i < 1'000; ++i) {
        const KsUUID uuid = KsUUID::random();
        EXPECT_EQ(uuid.bytes[6] >> 4, 4);
        EXPECT_EQ(uuid.bytes[8] >> 6, 2);
        EXPECT_EQ(KsUUID::parse(uuid.string()), uuid);
        seen.insert(uuid);
    }
    EXPECT_EQ(seen.size(), 1'000U);
}

}  // namespace
}  // namespace cindral
