#include "platform/revisions/Checksum.h"

#include <array>

#include "platform/revisions/PackedRecord.h"

namespace cindral {

namespace {

constexpr std::uint32_t kPolynomial = 0x82F63B78;  // Reflected.

// Eight tables, so that eight bytes are taken at a time ("slicing by 8").
constexpr auto kTables = [] {
    std::array<std::array<std::uint32_t, 256>, 8> tables{};
    for (std::uint32_t byte = 0; byte < 256; ++byte) {
        std::uint32_t sum = byte;
        for (int bit = 0; bit < 8; ++bit) sum = (sum >> 1) ^ ((sum & 1) != 0 ? kPolynomial : 0);
        tables[0][byte] = sum;
    }
    for (std::size_t table = 1; table < 8; ++table) {
        for (std::size_t byte = 0; byte < 256; ++byte) {
            const std::uint32_t sum = tables[table - 1][byte];
            tables[table][byte] = (sum >> 8) ^ tables[0][sum & 0xFF];
        }
    }
    return tables;
}();

}  // namespace

std::uint32_t crc32c(ByteView bytes, std::uint32_t before) {
    std::uint32_t sum = ~before;
    for (; bytes.size() >= 8; bytes = bytes.subspan(8)) {
        const std::uint64_t word = loadInteger<std::uint64_t>(bytes.data()) ^ sum;
        sum = 0;
        for (unsigned i = 0; i < 8; ++i) sum ^= kTables[7 - i][(word >> (8 * i)) & 0xFF];
    }
    for (const std::byte byte : bytes) {
        sum = (sum >> 8) ^ kTables[0][(sum ^ static_cast<std::uint32_t>(byte)) & 0xFF];
    }
    return ~sum;
}

}  // namespace cindral
