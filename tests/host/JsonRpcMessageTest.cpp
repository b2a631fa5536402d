#include "host/JsonRpcMessage.h"

#include <gtest/gtest.h>

namespace cindral {
namespace {

JsonRpcRequest request(std::string_view line) {
    JsonRpcLine decoded = decodeJsonRpcLine(line);
    if (decoded.entries.size() != 1 || !std::holds_alternative<JsonRpcRequest>(decoded.entries.front())) {
        ADD_FAILURE() << "no request: " << line.substr(0, 200);
        return {};
    }
    return std::get<JsonRpcRequest>(decoded.entries.front());
}

JsonRpcFault fault(std::string_view line) {
    JsonRpcLine decoded = decodeJsonRpcLine(line);
    if (decoded.entries.size() != 1 || !std::holds_alternative<JsonRpcFault>(decoded.entries.front())) {
        ADD_FAILURE() << "no fault: " << line.substr(0, 200);
        return {};
    }
    return std::get<JsonRpcFault>(decoded.entries.front());
}

JsonRpcCode code(std::string_view line) {
    return fault(line).code;
}

std::string idOf(std::string_view id) {
    return request(R"({"jsonrpc":"2.0","method":"m","id":)" + std::string(id) + "}").id;
}

TEST(JsonRpcMessage, readsARequest) {
    const JsonRpcRequest read = request(R"({"jsonrpc":"2.0","id":7,"method":"status","params":{"a":"b"}})");
    EXPECT_EQ(read.method, "status");
    EXPECT_EQ(read.id, "7");
    EXPECT_EQ(read.params, Json({{"a", "b"}}));
    EXPECT_FALSE(read.isNotification());
}

TEST(JsonRpcMessage, readsARequestWithoutParams) {
    EXPECT_EQ(request(R"({"jsonrpc":"2.0","id":7,"method":"status"})").params, Json::object());
}

TEST(JsonRpcMessage, readsARequestWithoutAnIDAsANotification) {
    EXPECT_TRUE(request(R"({"jsonrpc":"2.0","method":"status"})").isNotification());
    EXPECT_FALSE(request(R"({"jsonrpc":"2.0","method":"status","id":null})").isNotification());
}

TEST(JsonRpcMessage, echoesEveryIDExactly) {
    for (const char* id : {"0", "-1", "18446744073709551615", "-9223372036854775808", "9007199254740993", "1.5", "null",
                           R"("")", R"("a\"b")", R"("\u0000")", "\"\xC3\xA4\""}) {
        EXPECT_EQ(idOf(id), id);
    }
}

TEST(JsonRpcMessage, refusesAnIDThatCannotBeEchoed) {
    for (const char* id : {"18446744073709551616", "-9223372036854775809", "1e300", "true", "[]", "{}", "[1]"}) {
        const JsonRpcFault refused = fault(R"({"jsonrpc":"2.0","method":"m","id":)" + std::string(id) + "}");
        EXPECT_EQ(refused.code, JsonRpcCode::invalidRequest) << id;
        EXPECT_EQ(refused.id, "null");
    }
}

TEST(JsonRpcMessage, refusesWhatIsNotJSON) {
    using namespace std::string_literals;
    for (const std::string& line :
         {"{"s, "hello"s, "{}}"s, "[1,]"s, R"({"a":})"s, "{\"a\":\"\xFF\"}"s, R"({"a":"\ud800"})"s, "{\"a\":\"\x01\"}"s,
          "01"s, "1e999"s, "{'a':1}"s, "// comment"s, "NaN"s, "{\"a\":\"\xED\xA0\x80\"}"s, "{}\0{}"s, "{}\0"s}) {
        EXPECT_EQ(code(line), JsonRpcCode::parseError) << line;
    }
}

TEST(JsonRpcMessage, refusesWhatIsNoRequest) {
    for (const char* line :
         {"1", "null", "\"text\"", "{}", R"({"jsonrpc":"2.0","id":1})", R"({"id":1,"method":"m"})",
          R"({"jsonrpc":"1.0","id":1,"method":"m"})", R"({"jsonrpc":2.0,"id":1,"method":"m"})",
          R"({"jsonrpc":"2.0","id":1,"method":7})", R"({"jsonrpc":"2.0","id":1,"method":"m","params":"p"})",
          R"({"jsonrpc":"2.0","id":1,"method":"m","params":null})"}) {
        EXPECT_EQ(code(line), JsonRpcCode::invalidRequest) << line;
    }
}

TEST(JsonRpcMessage, answersAnInvalidRequestUnderItsIDWhereItHasOne) {
    EXPECT_EQ(fault(R"({"jsonrpc":"2.0","id":"x"})").id, "\"x\"");
    EXPECT_EQ(fault(R"({"method":"m"})").id, "null");
}

TEST(JsonRpcMessage, letsTheLastOfTwoEqualKeysCount) {
    EXPECT_EQ(request(R"({"jsonrpc":"2.0","id":1,"id":2,"method":"a","method":"b"})").id, "2");
    EXPECT_EQ(request(R"({"jsonrpc":"2.0","id":1,"id":2,"method":"a","method":"b"})").method, "b");
}

TEST(JsonRpcMessage, takesBlankLinesForNoMessage) {
    for (const char* line : {"", " ", "\t \r"}) EXPECT_TRUE(decodeJsonRpcLine(line).entries.empty());
}

TEST(JsonRpcMessage, readsABatch) {
    const JsonRpcLine line =
        decodeJsonRpcLine(R"([{"jsonrpc":"2.0","id":1,"method":"m"},3,{"jsonrpc":"2.0","method":"n"}])");
    EXPECT_TRUE(line.isBatch);
    ASSERT_EQ(line.entries.size(), 3U);
    EXPECT_EQ(std::get<JsonRpcRequest>(line.entries[0]).method, "m");
    EXPECT_EQ(std::get<JsonRpcFault>(line.entries[1]).code, JsonRpcCode::invalidRequest);
    EXPECT_TRUE(std::get<JsonRpcRequest>(line.entries[2]).isNotification());
}

TEST(JsonRpcMessage, refusesAnEmptyBatchAndOneThatIsTooLarge) {
    EXPECT_EQ(code("[]"), JsonRpcCode::invalidRequest);
    EXPECT_FALSE(decodeJsonRpcLine("[]").isBatch);
    std::string large = "[1";
    for (std::size_t i = 0; i < kJsonRpcBatchRequestsMax; ++i) large += ",1";
    EXPECT_EQ(code(large + "]"), JsonRpcCode::invalidRequest);
}

std::string nested(std::size_t depth) {
    return std::string(depth, '[') + std::string(depth, ']');
}

TEST(JsonRpcMessage, refusesDeepNestingBeforeItIsParsed) {
    EXPECT_FALSE(isJsonTooComplex(nested(64), 64, 1000));
    EXPECT_TRUE(isJsonTooComplex(nested(65), 64, 1000));
    EXPECT_EQ(code(R"({"jsonrpc":"2.0","id":1,"method":"m","params":{"a":)" + nested(10'000) + "}}"),
              JsonRpcCode::invalidRequest);
    EXPECT_EQ(code(std::string(1'000'000, '[')), JsonRpcCode::invalidRequest);
    EXPECT_EQ(code(std::string(1'000'000, '{')), JsonRpcCode::invalidRequest);
}

TEST(JsonRpcMessage, doesNotCountBracketsInStrings) {
    EXPECT_FALSE(isJsonTooComplex("\"" + std::string(1000, '[') + "\"", 64, 1000));
    EXPECT_FALSE(isJsonTooComplex(R"("\"[[[[[")", 3, 1000));
    EXPECT_TRUE(isJsonTooComplex(R"("\\"[[[[[)", 3, 1000));
    EXPECT_FALSE(isJsonTooComplex(R"("[[[\)", 2, 1000));
}

TEST(JsonRpcMessage, countsTheNestingThatIsOpenNotTheBrackets) {
    std::string flat;
    for (int i = 0; i < 400; ++i) flat += "[],";
    EXPECT_FALSE(isJsonTooComplex(flat, 1, 10'000));
}

TEST(JsonRpcMessage, refusesMoreValuesThanALineMayHold) {
    std::string line = R"({"jsonrpc":"2.0","id":1,"method":"m","params":{"a":[0)";
    for (std::size_t i = 0; i < kJsonRpcValuesMax; ++i) line += ",0";
    EXPECT_EQ(code(line + "]}}"), JsonRpcCode::invalidRequest);
}

TEST(JsonRpcMessage, writesAFault) {
    EXPECT_EQ(encodeJsonRpcFault({JsonRpcCode::parseError, "say \"why\"", "7"}),
              R"({"jsonrpc":"2.0","id":7,"error":{"code":-32700,"message":"say \"why\""}})");
}

}  // namespace
}  // namespace cindral
