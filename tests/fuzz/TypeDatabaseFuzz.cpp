#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/foundation/MimeGlobs.h"
#include "platform/foundation/MimeMagic.h"
#include "platform/foundation/MimeTypes.h"

using namespace cindral;

// The input is the four files of a MIME database in the order aliases, subclasses, globs2, magic, each but the last
// ended by a line "----". Whatever they say: nothing crashes or hangs, and answers are types of the database that
// agree with each other.

namespace {

std::string_view takeFile(std::string_view& input) {
    constexpr std::string_view kEnd = "----\n";
    const std::size_t end = std::min(input.find(kEnd), input.size());
    const std::string_view file = input.substr(0, end);
    input.remove_prefix(std::min(end + kEnd.size(), input.size()));
    return file;
}

void require(bool condition) {
    if (!condition) std::abort();
}

void checkType(const MimeTypes& types, MimeType type) {
    require(static_cast<std::size_t>(type) < types.size());
    const std::string& name = types.name(type);
    require(isMediaTypeName(name));
    require(types.conforms(name, name));
    require(!types.conforms(name, "com.vemra.package"));
    require(types.conforms(name, "application/octet-stream") ||
            types.name(types.canonical(type)).starts_with("inode/"));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    std::string_view rest(reinterpret_cast<const char*>(data), size);
    MimeTypes types;
    MimeGlobs globs;
    MimeMagic magic;
    types.addAliases(takeFile(rest));
    types.addSubclasses(takeFile(rest));
    const std::string_view patterns = takeFile(rest);
    globs.add(patterns, types);
    const ByteView sections = bytesOf(rest);
    magic.add(sections, types);

    require(magic.contentBytesMax() <= MimeMagic::kContentBytesMax);
    for (std::size_t from = 0; from < sections.size(); from += 1 + sections.size() / 16) {
        if (const auto type = magic.find(sections.subspan(from))) checkType(types, *type);
    }
    std::string lastPattern;
    forEachLine(patterns, [&](std::string_view line) {
        const std::string_view pattern = line.substr(std::min(line.rfind(':') + 1, line.size()));
        for (const auto& name :
             {std::string(pattern), "x" + std::string(pattern), lastPattern + std::string(pattern)}) {
            if (const auto type = globs.find(name)) checkType(types, *type);
        }
        require(matchesGlob("*", pattern));
        if (pattern.find_first_of("*?[\\") == std::string_view::npos) require(matchesGlob(pattern, pattern));
        matchesGlob(pattern, lastPattern);
        matchesGlob(lastPattern, pattern);
        lastPattern = pattern.substr(0, 100);
    });
    return 0;
}
