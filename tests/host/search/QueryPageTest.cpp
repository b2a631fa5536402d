#include "host/search/QueryPage.h"

#include <gtest/gtest.h>

namespace cindral::test {
namespace {

const QueryPage kPage{.index = 0x0123456789abcdef, .query = ~0ULL, .stage = 2, .rank = -7, .place = INT64_MAX};

TEST(QueryPage, decodesWhatItEncoded) {
    EXPECT_EQ(QueryPage::decode(kPage.encode()), kPage);
    EXPECT_EQ(QueryPage::decode(QueryPage().encode()), QueryPage());
}

TEST(QueryPage, rejectsEveryTruncation) {
    const Bytes bytes = kPage.encode();
    for (std::size_t size = 0; size < bytes.size(); ++size)
        EXPECT_EQ(QueryPage::decode(ByteView(bytes).first(size)), std::nullopt) << size;
}

TEST(QueryPage, rejectsWhatIsOfAnotherForm) {
    Bytes bytes = kPage.encode();
    bytes.front() = std::byte{2};
    EXPECT_EQ(QueryPage::decode(bytes), std::nullopt);
    bytes = kPage.encode();
    bytes.push_back(std::byte{0});
    EXPECT_EQ(QueryPage::decode(bytes), std::nullopt);
}

TEST(QueryPage, tellsQueriesApart) {
    const auto hash = QueryPage::queryHash;
    EXPECT_EQ(hash({SearchQuery::Kind::names, "a"}), hash({SearchQuery::Kind::names, "a"}));
    EXPECT_NE(hash({SearchQuery::Kind::names, "a"}), hash({SearchQuery::Kind::tagged, "a"}));
    EXPECT_NE(hash({SearchQuery::Kind::names, "a"}), hash({SearchQuery::Kind::names, "b"}));
}

// Clients keep pages over restarts.
TEST(QueryPage, hasTheBytesThatItAlwaysHad) {
    const QueryPage page{.index = 1, .query = 2, .stage = 1, .rank = -1, .place = 256};
    const Bytes bytes = page.encode();
    EXPECT_EQ(textOf(bytes),
              std::string_view("\x01\0\0\0\0\0\0\0\x01\0\0\0\0\0\0\0\x02\x01\xff\xff\xff\xff\xff\xff\xff\xff"
                               "\0\0\0\0\0\0\x01\0",
                               34));
}

}  // namespace
}  // namespace cindral::test
