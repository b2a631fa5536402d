#include "platform/foundation/MimeMagic.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <functional>
#include <iterator>
#include <string_view>
#include <utility>

namespace cindral {

namespace {

constexpr std::string_view kHeader{"MIME-Magic\0\n", 12};
constexpr std::string_view kClosingValue = "__NOMAGIC__";
constexpr std::uint32_t kPriorityMax = 100;
/// Far deeper than any rule in use; evaluation recurses as deep as rules nest.
constexpr std::uint32_t kIndentMax = 32;

/// Words are stored with their highest byte first, and stand in files as this machine would write them.
Bytes inMachineOrder(std::string_view words, std::size_t wordSize) {
    const ByteView view = bytesOf(words);
    Bytes bytes(view.begin(), view.end());
    if constexpr (std::endian::native == std::endian::little) {
        for (std::size_t at = 0; at < bytes.size(); at += wordSize) {
            std::reverse(bytes.begin() + static_cast<std::ptrdiff_t>(at),
                         bytes.begin() + static_cast<std::ptrdiff_t>(at + wordSize));
        }
    }
    return bytes;
}

}  // namespace

/// What one line says: value and mask as they stand in the file.
struct MimeMagic::Line {
    std::uint32_t indent = 0;
    std::uint32_t offset = 0;
    std::uint32_t range = 1;
    std::uint32_t wordSize = 1;
    std::string_view value;
    std::optional<std::string_view> mask;

    /// Bytes of a file that it can make use of.
    std::size_t end() const { return std::size_t{offset} + range - 1 + value.size(); }
    /// Whether it is something that a rule can be made of.
    bool isUsable() const {
        const bool hasWords = (wordSize == 1 || wordSize == 2 || wordSize == 4) && value.size() % wordSize == 0;
        return hasWords && !value.empty() && range > 0 && end() <= kContentBytesMax && indent <= kIndentMax;
    }
};

/// Takes a file apart from its beginning to its end. What it gives out borrows from the file.
class MimeMagic::Reader {
public:
    explicit Reader(std::string_view file) : rest_(file) {}

    bool atEnd() const { return rest_.empty(); }
    bool atSection() const { return rest_.starts_with('['); }
    bool skip(std::string_view text) {
        if (!rest_.starts_with(text)) return false;
        rest_.remove_prefix(text.size());
        return true;
    }

    /// Priority and type of "[priority:type]"; none when malformed. The line is consumed.
    std::optional<std::pair<int, std::string_view>> section() {
        const std::size_t end = rest_.find('\n');
        const std::string_view line = rest_.substr(0, end);
        skipLine();
        if (end == std::string_view::npos || !line.starts_with('[') || !line.ends_with(']')) return std::nullopt;
        Reader inside(line.substr(1, line.size() - 2));
        const auto priority = inside.number();
        if (!priority || *priority > kPriorityMax || !inside.skip(":") || !isMediaTypeName(inside.rest_))
            return std::nullopt;
        return std::pair(static_cast<int>(*priority), inside.rest_);
    }

    /// "[indent]>offset=length value[&mask][~word-size][+range]"; false when malformed, as fields of a later edition of
    /// the format make it. The line is consumed, and the indent is set in any case.
    bool line(Line& line) {
        line.indent = number().value_or(0);
        const bool isWellFormed = fields(line) && skip("\n");
        if (!isWellFormed) skipLine();
        return isWellFormed;
    }

private:
    bool fields(Line& line) {
        if (!skip(">") || !read(number(), line.offset) || !skip("=")) return false;
        const auto length = bytes(2);
        if (!length) return false;
        const std::size_t count =
            (static_cast<unsigned char>((*length)[0]) << 8U) | static_cast<unsigned char>((*length)[1]);
        if (!read(bytes(count), line.value)) return false;
        if (skip("&") && !read(bytes(count), line.mask)) return false;
        if (skip("~") && !read(number(), line.wordSize)) return false;
        return !skip("+") || read(number(), line.range);
    }

    /// None without a digit. Saturates far above any number that is of use.
    std::optional<std::uint32_t> number() {
        std::uint32_t number = 0;
        std::size_t digits = 0;
        for (; digits < rest_.size() && rest_[digits] >= '0' && rest_[digits] <= '9'; ++digits) {
            number =
                std::min<std::uint32_t>((number * 10) + static_cast<std::uint32_t>(rest_[digits] - '0'), 100'000'000);
        }
        rest_.remove_prefix(digits);
        if (digits == 0) return std::nullopt;
        return number;
    }

    std::optional<std::string_view> bytes(std::size_t count) {
        if (rest_.size() < count) return std::nullopt;
        const std::string_view bytes = rest_.substr(0, count);
        rest_.remove_prefix(count);
        return bytes;
    }

    template <typename From, typename To>
    static bool read(const std::optional<From>& from, To& to) {
        if (from) to = *from;
        return from.has_value();
    }

    void skipLine() {
        const std::size_t end = rest_.find('\n');
        rest_.remove_prefix(end == std::string_view::npos ? rest_.size() : end + 1);
    }

    std::string_view rest_;
};

void MimeMagic::add(ByteView file, MimeTypes& types) {
    Reader reader(textOf(file));
    if (!reader.skip(kHeader)) return;

    std::vector<MimeType> closing;
    while (!reader.atEnd()) {
        const auto head = reader.section();
        const std::size_t begin = rules_.size();
        const bool isClosing = addRules(reader);
        if (!head) {
            rules_.resize(begin);
            continue;
        }
        const MimeType type = types.canonical(types.add(head->second));
        if (isClosing) closing.push_back(type);
        if (isClosing || closed_.contains(static_cast<std::uint32_t>(type))) {
            rules_.resize(begin);
            continue;
        }
        sections_.push_back({head->first, type, begin, rules_.size()});
    }
    for (const MimeType type : closing) closed_.insert(static_cast<std::uint32_t>(type));
    std::ranges::stable_sort(sections_, std::greater(), &Section::priority);
}

/// The rules up to the next section. Whether one of them says that less important files don't count.
bool MimeMagic::addRules(Reader& reader) {
    bool isClosing = false;
    std::vector<std::size_t> open;  // The rule of each indent that the next line can be below of.
    while (!reader.atEnd() && !reader.atSection()) {
        Line line;
        const bool isWellFormed = reader.line(line);
        // Below a line that was passed over: on its own it would match what it should not.
        if (line.indent > open.size()) continue;
        closeRules(open, line.indent);
        if (!open.empty()) rules_[open.back()].hasChildren = true;
        if (!isWellFormed || !line.isUsable()) continue;
        isClosing = isClosing || line.value == kClosingValue;
        open.push_back(rules_.size());
        addRule(line);
    }
    closeRules(open, 0);
    return isClosing;
}

void MimeMagic::closeRules(std::vector<std::size_t>& open, std::size_t count) {
    for (; open.size() > count; open.pop_back()) rules_[open.back()].end = rules_.size();
}

void MimeMagic::addRule(const Line& line) {
    Rule rule;
    rule.offset = line.offset;
    rule.range = line.range;
    rule.length = line.value.size();
    rule.value = bytes_.size();
    rule.isMasked = line.mask.has_value();
    std::ranges::copy(inMachineOrder(line.value, line.wordSize), std::back_inserter(bytes_));
    if (line.mask) std::ranges::copy(inMachineOrder(*line.mask, line.wordSize), std::back_inserter(bytes_));
    rules_.push_back(rule);
    contentBytesMax_ = std::max(contentBytesMax_, line.end());
}

std::optional<MimeType> MimeMagic::find(ByteView beginning) const {
    const auto found = std::ranges::find_if(
        sections_, [&](const Section& section) { return anyMatches(section.begin, section.end, beginning); });
    if (found == sections_.end()) return std::nullopt;
    return found->type;
}

bool MimeMagic::anyMatches(std::size_t begin, std::size_t end, ByteView beginning) const {
    for (std::size_t i = begin; i < end; i = rules_[i].end) {
        const Rule& rule = rules_[i];
        if (matches(rule, beginning) && (!rule.hasChildren || anyMatches(i + 1, rule.end, beginning))) return true;
    }
    return false;
}

bool MimeMagic::matches(const Rule& rule, ByteView beginning) const {
    if (beginning.size() < rule.offset + rule.length) return false;
    const std::size_t places = std::min<std::size_t>(rule.range, beginning.size() - rule.offset - rule.length + 1);
    const std::byte* place = beginning.data() + rule.offset;
    const std::byte* const end = place + places;
    for (; place != end; ++place) {
        if (!rule.isMasked) place = std::find(place, end, bytes_[rule.value]);
        if (place == end) return false;
        if (matchesAt(rule, place)) return true;
    }
    return false;
}

bool MimeMagic::matchesAt(const Rule& rule, const std::byte* place) const {
    const std::byte* value = bytes_.data() + rule.value;
    if (!rule.isMasked) return std::memcmp(place, value, rule.length) == 0;
    const std::byte* mask = value + rule.length;
    for (std::size_t i = 0; i < rule.length; ++i) {
        if ((place[i] & mask[i]) != (value[i] & mask[i])) return false;
    }
    return true;
}

}  // namespace cindral
