// What decodes is a token of this version, and encodes and decodes again to the same token.

#include <cstdlib>

#include "provider/fs/FSChangeToken.h"

using cindral::FSChangeToken;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto token = FSChangeToken::decode(std::as_bytes(std::span(data, size)));
    if (!token) return 0;
    if (FSChangeToken::decode(token->encode()) != token) std::abort();
    return 0;
}
