#include "platform/foundation/Base64.h"

#include <gtest/gtest.h>

#include <array>
#include <utility>

namespace cindral {
namespace {

std::optional<std::string> decodedText(std::string_view text) {
    const auto bytes = base64Decode(text);
    if (!bytes) return std::nullopt;
    return std::string(textOf(*bytes));
}

TEST(Base64, encodesTheKnownExamples) {
    constexpr std::array<std::pair<std::string_view, std::string_view>, 7> kExamples{{{"", ""},
                                                                                      {"f", "Zg=="},
                                                                                      {"fo", "Zm8="},
                                                                                      {"foo", "Zm9v"},
                                                                                      {"foob", "Zm9vYg=="},
                                                                                      {"fooba", "Zm9vYmE="},
                                                                                      {"foobar", "Zm9vYmFy"}}};
    for (const auto& [plain, encoded] : kExamples) {
        EXPECT_EQ(base64Encode(bytesOf(plain)), encoded);
        EXPECT_EQ(decodedText(encoded), plain);
    }
    EXPECT_EQ(base64Encode(bytesOf("\xFB\xEF\xFF")), "++//");
}

TEST(Base64, appendsToWhatIsThere) {
    std::string text = "page:";
    appendBase64(text, bytesOf("foobar"));
    EXPECT_EQ(text, "page:Zm9vYmFy");
}

TEST(Base64, decodesWhatItEncodedOfAnyLength) {
    Bytes bytes;
    for (unsigned i = 0; i < 1'000; ++i) {
        EXPECT_EQ(base64Decode(base64Encode(bytes)), bytes) << i;
        bytes.push_back(static_cast<std::byte>(i * 167 + i / 256));
    }
}

// Every group of four out of characters that stand for what can go wrong.
TEST(Base64, decodesExactlyWhatItWouldHaveWritten) {
    constexpr std::string_view kCharacters("AQgwZ/+=-_ \n\0\xC3", 14);
    std::size_t decoded = 0;
    for (const char a : kCharacters) {
        for (const char b : kCharacters) {
            for (const char c : kCharacters) {
                for (const char d : kCharacters) {
                    for (const std::string prefix : {"", "Zm9v"}) {
                        const std::string text = prefix + a + b + c + d;
                        const auto bytes = base64Decode(text);
                        if (!bytes) continue;
                        ++decoded;
                        ASSERT_EQ(base64Encode(*bytes), text);
                    }
                }
            }
        }
    }
    // Seven of the characters are digits. The one before "=" has two bits beyond the last byte, the one before "=="
    // four.
    constexpr std::size_t kDigits = 7;
    std::size_t twoBitsClear = 0;
    std::size_t fourBitsClear = 0;
    for (const unsigned value : {0U, 16U, 32U, 48U, 25U, 63U, 62U}) {
        twoBitsClear += value % 4 == 0;
        fourBitsClear += value % 16 == 0;
    }
    EXPECT_EQ(decoded,
              2 * (kDigits * kDigits * kDigits * kDigits + kDigits * kDigits * twoBitsClear + kDigits * fourBitsClear));
}

TEST(Base64, refusesOtherLengths) {
    for (const std::string_view text :
         {"Z", "Zg", "Zm8", "Zg=", "Zm9vY", "Zm9vYg=", "Zg==Zg==", "=", "==", "===", "====", "Zg===", "Zm9v===="}) {
        EXPECT_FALSE(base64Decode(text)) << text;
    }
}

}  // namespace
}  // namespace cindral
