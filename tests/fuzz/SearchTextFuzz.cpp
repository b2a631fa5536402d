// Pages of queries, and names beside what is looked for: a page that is read is written the same; a name is folded once
// and for all; and every name that matches holds the grams that it is found by.

#include <cstdlib>
#include <set>
#include <string>

#include "host/search/NameFolding.h"
#include "host/search/QueryPage.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

namespace {

void checkPage(ByteView bytes) {
    const auto page = QueryPage::decode(bytes);
    if (!page) return;
    const Bytes written = page->encode();
    if (textOf(written) != textOf(bytes)) std::abort();
}

void checkName(std::string_view name, std::string_view text) {
    const std::string folded = name_folding::fold(name);
    if (name_folding::fold(folded) != folded || folded.find('/') != std::string::npos) std::abort();
    const std::string wanted = name_folding::fold(text);
    if (wanted.empty()) return;
    const auto match = nameMatchOf(folded, wanted);
    if (match.has_value() != (folded.find(wanted) != std::string::npos)) std::abort();
    if (!match) return;
    std::set<std::string, std::less<>> grams;
    name_grams::forEach(folded, [&](std::string_view gram) { return grams.emplace(gram).second || true; });
    for (const NameMatch each : {*match, NameMatch::substring}) {
        for (const std::string& gram : name_grams::required(wanted, each)) {
            if (!grams.contains(gram)) std::abort();
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    checkPage(bytesOf(text));
    // The first byte says how much of the rest is looked for in all of it.
    if (text.empty()) return 0;
    const std::string_view name = text.substr(1);
    const auto begin = static_cast<unsigned char>(text.front()) % (name.size() + 1);
    checkName(name, name.substr(begin, 5));
    checkName(name, name.substr(begin));
    return 0;
}
