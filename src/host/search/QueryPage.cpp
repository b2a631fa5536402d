#include "host/search/QueryPage.h"

#include <cstddef>
#include <span>

namespace cindral {
namespace {

// Clients keep pages: another number for another form.
constexpr std::byte kForm{1};
constexpr std::size_t kSize = 1 + 8 + 8 + 1 + 8 + 8;

void put(Bytes& out, std::uint64_t value) {
    for (int shift = 56; shift >= 0; shift -= 8) out.push_back(static_cast<std::byte>(value >> shift));
}

std::uint64_t take(ByteView& in) {
    std::uint64_t value = 0;
    for (const std::byte each : in.first(8)) value = value << 8 | static_cast<std::uint64_t>(each);
    in = in.subspan(8);
    return value;
}

}  // namespace

Bytes QueryPage::encode() const {
    Bytes out{kForm};
    out.reserve(kSize);
    put(out, index);
    put(out, query);
    out.push_back(static_cast<std::byte>(stage));
    put(out, static_cast<std::uint64_t>(rank));
    put(out, static_cast<std::uint64_t>(place));
    return out;
}

std::optional<QueryPage> QueryPage::decode(ByteView bytes) {
    if (bytes.size() != kSize || bytes.front() != kForm) return std::nullopt;
    bytes = bytes.subspan(1);
    QueryPage page;
    page.index = take(bytes);
    page.query = take(bytes);
    page.stage = static_cast<std::uint8_t>(bytes.front());
    bytes = bytes.subspan(1);
    page.rank = static_cast<std::int64_t>(take(bytes));
    page.place = static_cast<std::int64_t>(take(bytes));
    return page;
}

std::uint64_t QueryPage::queryHash(const SearchQuery& query) {
    // FNV-1a: the same in every process, and nothing rests on its being hard to guess.
    std::uint64_t hash = 0xcbf29ce484222325 ^ static_cast<std::uint64_t>(query.kind);
    for (const char c : query.text) hash = (hash ^ static_cast<unsigned char>(c)) * 0x100000001b3;
    return hash;
}

}  // namespace cindral
