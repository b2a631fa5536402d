#include "platform/revisions/NameHash.h"

#include <bit>

#include "platform/foundation/KsUUID.h"
#include "platform/revisions/PackedRecord.h"

namespace cindral {

NameHashKey randomNameHashKey() {
    // Of its 128 bits 122 are random, which nobody can guess either.
    NameHashKey key{};
    std::memcpy(key.data(), KsUUID::random().bytes.data(), key.size());
    return key;
}

namespace {

struct SipState {
    std::uint64_t v0, v1, v2, v3;

    void round() {
        v0 += v1;
        v1 = std::rotl(v1, 13) ^ v0;
        v0 = std::rotl(v0, 32);
        v2 += v3;
        v3 = std::rotl(v3, 16) ^ v2;
        v0 += v3;
        v3 = std::rotl(v3, 21) ^ v0;
        v2 += v1;
        v1 = std::rotl(v1, 17) ^ v2;
        v2 = std::rotl(v2, 32);
    }
    void take(std::uint64_t word) {
        v3 ^= word;
        round();
        round();
        v0 ^= word;
    }
};

}  // namespace

std::uint64_t sipHash(const NameHashKey& key, ByteView bytes) {
    const auto* keyBytes = reinterpret_cast<const std::byte*>(key.data());
    const auto k0 = loadInteger<std::uint64_t>(keyBytes), k1 = loadInteger<std::uint64_t>(keyBytes + 8);
    SipState state{k0 ^ 0x736f6d6570736575, k1 ^ 0x646f72616e646f6d, k0 ^ 0x6c7967656e657261, k1 ^ 0x7465646279746573};
    std::uint64_t last = static_cast<std::uint64_t>(bytes.size()) << 56;
    for (; bytes.size() >= 8; bytes = bytes.subspan(8)) state.take(loadInteger<std::uint64_t>(bytes.data()));
    for (std::size_t i = 0; i < bytes.size(); ++i) last |= static_cast<std::uint64_t>(bytes[i]) << (8 * i);
    state.take(last);
    state.v2 ^= 0xFF;
    for (int i = 0; i < 4; ++i) state.round();
    return state.v0 ^ state.v1 ^ state.v2 ^ state.v3;
}

}  // namespace cindral
