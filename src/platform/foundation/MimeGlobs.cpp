#include "platform/foundation/MimeGlobs.h"

#include <algorithm>
#include <bit>
#include <charconv>
#include <tuple>

#include "platform/foundation/Utf8.h"

namespace cindral {

namespace {

constexpr int kWeightMax = 100;
/// Ranks a whole name above any pattern of its weight.
constexpr std::size_t kWholeNameLength = std::string_view::npos;
/// The lower-case form of a name, without an allocation for a name that a file can have: 255 bytes at most.
class FoldedName {
public:
    explicit FoldedName(std::string_view name) : size_(name.size()) {
        if (size_ > small_.size()) large_.resize(size_);
        std::ranges::transform(name, size_ > small_.size() ? large_.data() : small_.data(), lowerASCII);
    }
    std::string_view view() const { return {size_ > small_.size() ? large_.data() : small_.data(), size_}; }

private:
    std::size_t size_;
    std::array<char, 255> small_;
    std::string large_;
};

std::string_view takeField(std::string_view& line) {
    const std::size_t end = line.find(':');
    const std::string_view field = line.substr(0, end);
    line.remove_prefix(end == std::string_view::npos ? line.size() : end + 1);
    return field;
}

std::optional<int> weightOf(std::string_view text) {
    int weight = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), weight);
    if (error != std::errc() || end != text.data() + text.size() || weight < 0 || weight > kWeightMax)
        return std::nullopt;
    return weight;
}

bool hasFlag(std::string_view flags, std::string_view wanted) {
    while (!flags.empty()) {
        const std::size_t comma = flags.find(',');
        if (flags.substr(0, comma) == wanted) return true;
        if (comma == std::string_view::npos) return false;
        flags.remove_prefix(comma + 1);
    }
    return false;
}

bool hasWildcard(std::string_view pattern) {
    return pattern.find_first_of("*?[\\") != std::string_view::npos;
}

/// The part of a pattern that stands for one byte, or '*'. Never empty for a pattern that isn't.
std::string_view firstElement(std::string_view pattern) {
    if (pattern[0] == '\\' && pattern.size() > 1) return pattern.substr(0, 2);
    if (pattern[0] != '[') return pattern.substr(0, 1);
    std::size_t at = 1;
    if (at < pattern.size() && (pattern[at] == '!' || pattern[at] == '^')) ++at;
    // A bracket that closes at once is one of the bytes; one that never closes stands for itself.
    const std::size_t close = pattern.find(']', at + 1);
    return pattern.substr(0, close == std::string_view::npos ? 1 : close + 1);
}

bool setTakes(std::string_view set, unsigned char byte) {
    const bool negated = set[0] == '!' || set[0] == '^';
    if (negated) set.remove_prefix(1);
    bool found = false;
    while (!set.empty()) {
        const bool isRange = set.size() > 2 && set[1] == '-';
        const auto low = static_cast<unsigned char>(set[0]);
        const auto high = static_cast<unsigned char>(isRange ? set[2] : set[0]);
        found = found || (byte >= low && byte <= high);
        set.remove_prefix(isRange ? 3 : 1);
    }
    return found != negated;
}

bool elementTakes(std::string_view element, char byte) {
    if (element.size() == 1) return element[0] == '?' || element[0] == byte;
    if (element[0] == '\\') return element[1] == byte;
    return setTakes(element.substr(1, element.size() - 2), static_cast<unsigned char>(byte));
}

std::string_view lastElement(std::string_view pattern) {
    std::string_view element;
    for (; !pattern.empty(); pattern.remove_prefix(element.size())) element = firstElement(pattern);
    return element;
}

void markBytes(std::array<std::uint64_t, 256>& table, std::uint64_t bit, std::string_view element) {
    for (std::size_t byte = 0; byte < table.size(); ++byte) {
        if (element == "*" || elementTakes(element, static_cast<char>(byte))) table[byte] |= bit;
    }
}

}  // namespace

bool matchesGlob(std::string_view pattern, std::string_view text) {
    // Only the last '*' ever has to take more: what an earlier one took is settled when a later one is reached.
    std::string_view afterStar;
    std::string_view starText;
    bool hasStar = false;
    while (!text.empty() || !pattern.empty()) {
        if (!pattern.empty() && pattern[0] == '*') {
            pattern.remove_prefix(1);
            if (pattern.empty()) return true;
            afterStar = pattern;
            starText = text;
            hasStar = true;
            continue;
        }
        if (!pattern.empty() && !text.empty()) {
            const std::string_view element = firstElement(pattern);
            if (elementTakes(element, text[0])) {
                pattern.remove_prefix(element.size());
                text.remove_prefix(1);
                continue;
            }
        }
        if (!hasStar || starText.empty()) return false;
        starText.remove_prefix(1);
        if (!hasWildcard(afterStar.substr(0, 1)))
            starText.remove_prefix(std::min(starText.find(afterStar[0]), starText.size()));
        text = starText;
        pattern = afterStar;
    }
    return true;
}

void MimeGlobs::add(std::string_view text, MimeTypes& types) {
    FileState state;
    forEachLine(text, [&](std::string_view line) { addLine(line, types, state); });
    for (const MimeType type : state.closing) closed_.insert(static_cast<std::uint32_t>(type));
    ++files_;
    groupPatterns(types);
}

void MimeGlobs::addLine(std::string_view line, MimeTypes& types, FileState& state) {
    if (line.starts_with('#')) return;
    const auto weight = weightOf(takeField(line));
    const std::string_view name = takeField(line);
    const std::string_view pattern = takeField(line);
    const std::string_view flags = takeField(line);
    if (!weight || !isMediaTypeName(name) || pattern.empty()) return;

    const MimeType type = types.canonical(types.add(name));
    if (pattern == "__NOGLOBS__") return state.closing.push_back(type);
    if (closed_.contains(static_cast<std::uint32_t>(type))) return;

    const Candidate candidate{*weight, files_, type};
    std::pair key(type, std::string(pattern));
    if (hasFlag(flags, "cs")) {
        state.caseSensitive.insert(std::move(key));
        return addPattern(pattern, candidate, true, types);
    }
    // A pattern with flags stands there once more without, for readers that know none.
    if (state.caseSensitive.contains(key)) return;
    std::string folded(pattern);
    std::ranges::transform(folded, folded.begin(), lowerASCII);
    addPattern(folded, candidate, false, types);
}

void MimeGlobs::addPattern(std::string_view pattern, const Candidate& candidate, bool caseSensitive,
                           const MimeTypes& types) {
    const bool isSuffix = pattern.starts_with("*.") && !hasWildcard(pattern.substr(1));
    if (!isSuffix && hasWildcard(pattern)) {
        patterns_.push_back({std::string(pattern), candidate, caseSensitive});
        return;
    }
    const std::string_view key = isSuffix ? pattern.substr(2) : pattern;
    std::size_t& lengthMax = isSuffix ? suffixLengthMax_ : nameLengthMax_;
    lengthMax = std::max(lengthMax, key.size());

    const auto isBetterThan = [&](const Candidate& other) {
        if (candidate.weight != other.weight) return candidate.weight > other.weight;
        if (candidate.file != other.file) return candidate.file < other.file;
        return types.name(candidate.type) < types.name(other.type);
    };
    Entry& entry = (isSuffix ? suffixes_ : names_)[std::string(key)];
    if (isBetterThan(entry.asGiven)) entry.asGiven = candidate;
    if (!caseSensitive && isBetterThan(entry.folded)) entry.folded = candidate;
}

void MimeGlobs::groupPatterns(const MimeTypes& types) {
    std::ranges::stable_sort(patterns_, [&](const Pattern& a, const Pattern& b) {
        return std::tuple(-a.candidate.weight, b.text.size(), a.candidate.file,
                          std::string_view(types.name(a.candidate.type))) <
               std::tuple(-b.candidate.weight, a.text.size(), b.candidate.file,
                          std::string_view(types.name(b.candidate.type)));
    });
    groups_.assign((patterns_.size() + 63) / 64, {});
    for (std::size_t i = 0; i < patterns_.size(); ++i) {
        const std::uint64_t bit = std::uint64_t{1} << (i % 64);
        markBytes(groups_[i / 64].byFirst, bit, firstElement(patterns_[i].text));
        markBytes(groups_[i / 64].byLast, bit, lastElement(patterns_[i].text));
    }
}

std::optional<MimeType> MimeGlobs::find(std::string_view name) const {
    if (name.empty()) return std::nullopt;
    if (const auto type = match(name, Case::asGiven, findWholeName(name))) return type;
    if (std::ranges::none_of(name, isUpperASCII)) return std::nullopt;
    return match(FoldedName(name).view(), Case::folded, {});
}

/// Both forms of the name, before any pattern is looked at: "CMakeLists.txt" is more than some text.
MimeGlobs::Candidate MimeGlobs::findWholeName(std::string_view name) const {
    if (name.size() > nameLengthMax_) return {};
    if (const auto place = names_.find(name); place != names_.end()) return place->second.asGiven;
    if (std::ranges::none_of(name, isUpperASCII)) return {};
    const auto place = names_.find(FoldedName(name).view());
    return place == names_.end() ? Candidate() : place->second.folded;
}

std::optional<MimeType> MimeGlobs::match(std::string_view name, Case matching, Candidate best) const {
    std::size_t bestLength = best.weight < 0 ? 0 : kWholeNameLength;
    // From the longest suffix to the shortest, so that the first of equal weight stays.
    for (std::size_t dot = name.find('.'); dot != std::string_view::npos; dot = name.find('.', dot + 1)) {
        const std::string_view suffix = name.substr(dot + 1);
        if (suffix.size() > suffixLengthMax_) continue;
        const auto place = suffixes_.find(suffix);
        if (place == suffixes_.end() || place->second.of(matching).weight <= best.weight) continue;
        best = place->second.of(matching);
        bestLength = suffix.size() + 2;
    }
    if (const Candidate* other = matchPatterns(name, matching, best, bestLength)) best = *other;
    if (best.weight < 0) return std::nullopt;
    return best.type;
}

/// The first of the patterns that matches and is better than what was found already.
const MimeGlobs::Candidate* MimeGlobs::matchPatterns(std::string_view name, Case matching, const Candidate& best,
                                                     std::size_t bestLength) const {
    const auto first = static_cast<unsigned char>(name.front());
    const auto last = static_cast<unsigned char>(name.back());
    for (std::size_t group = 0; group < groups_.size(); ++group) {
        std::uint64_t possible = groups_[group].byFirst[first] & groups_[group].byLast[last];
        for (; possible != 0; possible &= possible - 1) {
            const Pattern& pattern = patterns_[(group * 64) + static_cast<std::size_t>(std::countr_zero(possible))];
            const int weight = pattern.candidate.weight;
            if (weight < best.weight || (weight == best.weight && pattern.text.size() <= bestLength)) return nullptr;
            if (matching == Case::folded && pattern.caseSensitive) continue;
            if (matchesGlob(pattern.text, name)) return &pattern.candidate;
        }
    }
    return nullptr;
}

}  // namespace cindral
