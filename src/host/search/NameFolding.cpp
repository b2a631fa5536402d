#include "host/search/NameFolding.h"

#include <fmt/format.h>
#include <unicode/normalizer2.h>
#include <unicode/uchar.h>
#include <unicode/unistr.h>
#include <unicode/utf8.h>

#include <algorithm>
#include <cstdlib>

namespace cindral {
namespace {

// Written into the index: another number for other rules.
constexpr int kRules = 1;
// No name holds it; what looks like it and would become it stays what it is.
constexpr char16_t kSlash = u'/';
constexpr char16_t kWideSlash = u'\uFF0F';
// More are not needed to leave few names over, and each costs a look into the index.
constexpr std::size_t kRequiredGramsMax = 16;

/// Letters that bear their mark in themselves: no decomposition takes it off.
struct MarkedLetter {
    char16_t letter;
    const char16_t* plain;
};
constexpr MarkedLetter kMarkedLetters[] = {
    {u'\u00E6', u"ae"}, {u'\u00F0', u"d"}, {u'\u00F8', u"o"}, {u'\u00FE', u"th"}, {u'\u0111', u"d"},
    {u'\u0127', u"h"},  {u'\u0131', u"i"}, {u'\u0142', u"l"}, {u'\u0153', u"oe"}, {u'\u0167', u"t"},
};

bool isAscii(std::string_view text) {
    return std::ranges::all_of(text, [](char c) { return static_cast<unsigned char>(c) < 0x80; });
}

std::string foldAscii(std::string_view text) {
    std::string out(text);
    for (char& c : out) {
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    }
    return out;
}

/// The marks that letters of Latin, Greek and Cyrillic script bear. Those of other scripts are part of what is written.
bool isDiacritic(UChar32 c) {
    return (c >= 0x0300 && c <= 0x036F) || (c >= 0x1AB0 && c <= 0x1AFF) || (c >= 0x1DC0 && c <= 0x1DFF) ||
           (c >= 0x20D0 && c <= 0x20FF) || (c >= 0xFE20 && c <= 0xFE2F);
}

const icu::Normalizer2& normalizer(const icu::Normalizer2* (*instance)(UErrorCode&)) {
    UErrorCode status = U_ZERO_ERROR;
    const icu::Normalizer2* found = instance(status);
    // Its data is part of the library.
    if (U_FAILURE(status)) std::abort();
    return *found;
}

icu::UnicodeString normalized(const icu::Normalizer2& form, const icu::UnicodeString& text) {
    UErrorCode status = U_ZERO_ERROR;
    icu::UnicodeString out = form.normalize(text, status);
    if (U_FAILURE(status)) std::abort();
    return out;
}

icu::UnicodeString withoutDiacritics(const icu::UnicodeString& decomposed) {
    icu::UnicodeString out;
    for (int32_t i = 0; i < decomposed.length(); i = decomposed.moveIndex32(i, 1)) {
        const UChar32 c = decomposed.char32At(i);
        if (isDiacritic(c)) continue;
        const auto* marked = std::ranges::find(kMarkedLetters, c, &MarkedLetter::letter);
        if (marked != std::end(kMarkedLetters)) {
            out.append(marked->plain, -1);
        } else {
            out.append(c == kSlash ? kWideSlash : c);
        }
    }
    return out;
}

icu::UnicodeString foldedOnce(const icu::UnicodeString& text) {
    static const icu::Normalizer2& caseFold = normalizer(icu::Normalizer2::getNFKCCasefoldInstance);
    static const icu::Normalizer2& decomposed = normalizer(icu::Normalizer2::getNFDInstance);
    static const icu::Normalizer2& composed = normalizer(icu::Normalizer2::getNFCInstance);
    return normalized(composed, withoutDiacritics(normalized(decomposed, normalized(caseFold, text))));
}

bool isWordCharacter(UChar32 c) {
    return u_isalnum(c) != 0 || (U_GET_GC_MASK(c) & U_GC_M_MASK) != 0;
}

/// Where the characters of a folded text begin, and its end; and which of them begin words.
struct Characters {
    std::vector<std::uint32_t> begins;
    std::vector<bool> beginWords;

    explicit Characters(std::string_view folded) {
        begins.reserve(folded.size() + 1);
        bool isInWord = false;
        const auto length = static_cast<int32_t>(folded.size());
        for (int32_t i = 0; i < length;) {
            begins.push_back(static_cast<std::uint32_t>(i));
            UChar32 c = 0;
            U8_NEXT_OR_FFFD(folded.data(), i, length, c);
            const bool isWord = isWordCharacter(c);
            beginWords.push_back(isWord && !isInWord);
            isInWord = isWord;
        }
        begins.push_back(static_cast<std::uint32_t>(length));
    }
    std::size_t count() const { return beginWords.size(); }
    std::string_view slice(std::string_view folded, std::size_t first, std::size_t characters) const {
        return folded.substr(begins[first], begins[first + characters] - begins[first]);
    }
};

bool isFoundBy(std::string_view gram, std::size_t characters) {
    return characters >= 3 || !isAscii(gram);
}

bool beginsWord(std::string_view name, std::size_t at) {
    const auto length = static_cast<int32_t>(name.size());
    auto i = static_cast<int32_t>(at);
    UChar32 c = 0;
    U8_NEXT_OR_FFFD(name.data(), i, length, c);
    if (!isWordCharacter(c)) return false;
    if (at == 0) return true;
    i = static_cast<int32_t>(at);
    U8_PREV_OR_FFFD(name.data(), 0, i, c);
    return !isWordCharacter(c);
}

}  // namespace

std::string name_folding::fold(std::string_view name) {
    if (isAscii(name) && name.find('/') == std::string_view::npos) return foldAscii(name);
    icu::UnicodeString text =
        icu::UnicodeString::fromUTF8(icu::StringPiece(name.data(), static_cast<int32_t>(name.size())));
    // What a letter loses may make others of its neighbours; it comes to rest at once or with the second round.
    for (int round = 0; round < 4; ++round) {
        icu::UnicodeString folded = foldedOnce(text);
        const bool isDone = folded == text;
        text = std::move(folded);
        if (isDone) break;
    }
    std::string out;
    return text.toUTF8String(out);
}

std::string name_folding::version() {
    return fmt::format("{}/{}", kRules, U_ICU_VERSION);
}

std::optional<NameMatch> nameMatchOf(std::string_view name, std::string_view text) {
    std::size_t at = name.find(text);
    if (at == std::string_view::npos) return std::nullopt;
    if (at == 0) return NameMatch::prefix;
    for (; at != std::string_view::npos; at = name.find(text, at + 1)) {
        if (beginsWord(name, at)) return NameMatch::word;
    }
    return NameMatch::substring;
}

bool name_grams::forEach(std::string_view folded, const Receiver& receiver) {
    const Characters characters(folded);
    const std::size_t count = characters.count();
    std::string marked;
    for (std::size_t i = 0; i < count; ++i) {
        const std::size_t lengthMax = std::min<std::size_t>(3, count - i);
        for (std::size_t length = 1; length <= lengthMax; ++length) {
            const std::string_view gram = characters.slice(folded, i, length);
            if (isFoundBy(gram, length) && !receiver(gram)) return false;
        }
        if (i > 0 && !characters.beginWords[i]) continue;
        for (std::size_t length = 1; length <= std::min<std::size_t>(2, lengthMax); ++length) {
            const std::string_view gram = characters.slice(folded, i, length);
            if (i == 0) {
                marked.assign(1, '/').append(gram);
                if (!receiver(marked)) return false;
            } else {
                marked.assign(gram).append(1, '/');
                if (!receiver(marked)) return false;
            }
        }
    }
    return true;
}

std::vector<std::string> name_grams::required(std::string_view text, NameMatch match) {
    const Characters characters(text);
    const std::size_t count = characters.count();
    std::vector<std::string> grams;
    const auto first = characters.slice(text, 0, std::min<std::size_t>(2, count));
    switch (match) {
        case NameMatch::prefix: grams.push_back("/" + std::string(first)); break;
        case NameMatch::word: grams.push_back(std::string(first) + "/"); break;
        case NameMatch::substring: break;
    }
    if (count < 3) {
        if (match == NameMatch::substring && isFoundBy(text, count)) grams.emplace_back(text);
        return grams;
    }
    // Spread over the text: neighbours say almost the same.
    const std::size_t trigrams = count - 2;
    const std::size_t wanted = std::min(trigrams, kRequiredGramsMax);
    for (std::size_t i = 0; i < wanted; ++i) {
        const std::size_t at = wanted == 1 ? 0 : i * (trigrams - 1) / (wanted - 1);
        grams.emplace_back(characters.slice(text, at, 3));
    }
    std::ranges::sort(grams);
    const auto twice = std::ranges::unique(grams);
    grams.erase(twice.begin(), twice.end());
    return grams;
}

}  // namespace cindral
