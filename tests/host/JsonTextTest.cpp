#include "host/JsonText.h"

#include <gtest/gtest.h>

#include <limits>
#include <nlohmann/json.hpp>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Utf8.h"

namespace cindral {
namespace {

std::string percentEncoded(std::string_view path) {
    std::string out;
    appendPercentEncoded(out, path);
    return out;
}

TEST(JsonText, leavesOrdinaryTextAsItIs) {
    EXPECT_EQ(jsonString("Ann\xC3\xA4herung 1/2.txt"), "\"Ann\xC3\xA4herung 1/2.txt\"");
    EXPECT_EQ(jsonString(""), "\"\"");
    EXPECT_EQ(jsonString("\x7F"), "\"\x7F\"");
}

TEST(JsonText, escapesQuotesBackslashesAndControlCharacters) {
    EXPECT_EQ(jsonString("a\"b\\c"), R"("a\"b\\c")");
    EXPECT_EQ(jsonString("\b\f\n\r\t"), R"("\b\f\n\r\t")");
    EXPECT_EQ(jsonString(std::string_view("\0\x1B\x1F", 3)), R"("\u0000\u001b\u001f")");
}

TEST(JsonText, replacesWhatIsNotUtf8) {
    EXPECT_EQ(jsonString("\xFF"), "\"\xEF\xBF\xBD\"");
    EXPECT_EQ(jsonString("a\xE2\x82z"), "\"a\xEF\xBF\xBDz\"");
    EXPECT_EQ(jsonString("\xED\xA0\x80"), "\"\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\"");
}

// Another parser reads back what was written, whatever the bytes.
TEST(JsonText, isReadBackByAnotherParser) {
    for (int first = 0; first < 256; ++first) {
        for (int second = 0; second < 256; ++second) {
            const std::string text{'<', static_cast<char>(first), static_cast<char>(second), '>'};
            const auto parsed = nlohmann::json::parse(jsonString(text), nullptr, false);
            ASSERT_TRUE(parsed.is_string()) << first << ' ' << second;
            if (isUtf8(text)) {
                ASSERT_EQ(parsed.get<std::string>(), text);
            }
        }
    }
}

TEST(JsonText, writesNumbersToTheirLastDigit) {
    std::string out;
    appendJsonNumber(out, std::numeric_limits<std::uint64_t>::max());
    out += ' ';
    appendJsonNumber(out, std::numeric_limits<std::int64_t>::min());
    EXPECT_EQ(out, "18446744073709551615 -9223372036854775808");
}

TEST(JsonText, percentEncodesEveryByteThatIsNotUnreserved) {
    EXPECT_EQ(percentEncoded("/a b/100%/\xFF\n.txt"), "/a%20b/100%25/%FF%0A.txt");
    EXPECT_EQ(percentEncoded("/AZaz09-._~"), "/AZaz09-._~");
    EXPECT_EQ(percentEncoded(":?#[]@!$&'()*+,;="), "%3A%3F%23%5B%5D%40%21%24%26%27%28%29%2A%2B%2C%3B%3D");
}

// The host encodes a listing's URLs itself; they have to be the ones that the URL type writes and reads.
TEST(JsonText, percentEncodesAsURLsDo) {
    std::string path = "/";
    for (int byte = 1; byte < 256; ++byte) path += static_cast<char>(byte == '/' ? 'x' : byte);
    const KsURL url = KsURL::fileURL(path);
    EXPECT_EQ("file://" + percentEncoded(path), url.absoluteString());
    EXPECT_EQ(KsURL::parse("file://" + percentEncoded(path)), url);
}

}  // namespace
}  // namespace cindral
