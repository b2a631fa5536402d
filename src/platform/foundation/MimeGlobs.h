#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "platform/foundation/MimeTypes.h"

namespace cindral {

/// Types by the names of files: the patterns of the MIME database's "globs2" files (docs/type-database.md).
///
/// The pattern of the highest weight wins, then a whole name, then the longest pattern, then the more important file,
/// then the type whose name sorts first.
///
/// Finding a type costs a hash look-up for each dot of the name, and no allocation for names that a file can have.
///
/// Thread safety: add first, by one thread; then find by any.
class MimeGlobs {
public:
    /// Adds the lines of one file, most important file first. Lines that are malformed are passed over.
    void add(std::string_view text, MimeTypes& types);

    /// None when no pattern matches. The name as it is comes first; only when it matches nothing, its lower-case form
    /// is tried against the patterns that don't insist on case. A whole name is found in either form at once.
    /// Only letters of ASCII have case.
    std::optional<MimeType> find(std::string_view name) const;

private:
    enum class Case { asGiven, folded };

    /// A type that a pattern stands for, and how much that counts. Nothing when the weight is negative.
    struct Candidate {
        int weight = -1;
        std::uint32_t file = 0;  ///< number of the file, the most important first
        MimeType type{};
    };
    /// What one text stands for: as it is written, and among the patterns that don't insist on case.
    struct Entry {
        Candidate asGiven;
        Candidate folded;
        const Candidate& of(Case matching) const { return matching == Case::asGiven ? asGiven : folded; }
    };
    struct Pattern {
        std::string text;
        Candidate candidate;
        bool caseSensitive = false;
    };
    /// 64 patterns, and for each byte which of them a name may match that begins, or ends, with it.
    struct PatternGroup {
        std::array<std::uint64_t, 256> byFirst{};
        std::array<std::uint64_t, 256> byLast{};
    };
    struct TextHash {
        using is_transparent = void;  // NOLINT(readability-identifier-naming): the library looks for it.
        std::size_t operator()(std::string_view text) const { return std::hash<std::string_view>{}(text); }
    };
    using Table = std::unordered_map<std::string, Entry, TextHash, std::equal_to<>>;

    /// What the lines read so far mean for later lines, and the file for later files.
    struct FileState {
        std::set<std::pair<MimeType, std::string>> caseSensitive;
        std::vector<MimeType> closing;
    };

    void addLine(std::string_view line, MimeTypes& types, FileState& state);
    void addPattern(std::string_view pattern, const Candidate& candidate, bool caseSensitive, const MimeTypes& types);
    void groupPatterns(const MimeTypes& types);
    Candidate findWholeName(std::string_view name) const;
    std::optional<MimeType> match(std::string_view name, Case matching, Candidate best) const;
    const Candidate* matchPatterns(std::string_view name, Case matching, const Candidate& best,
                                   std::size_t bestLength) const;

    Table names_;     ///< whole names: "makefile"
    Table suffixes_;  ///< what follows "*.": "txt", "tar.gz"
    std::size_t nameLengthMax_ = 0;
    std::size_t suffixLengthMax_ = 0;
    std::vector<Pattern> patterns_;  ///< all others, best first
    std::vector<PatternGroup> groups_;
    std::unordered_set<std::uint32_t> closed_;  ///< types that take no patterns from less important files
    std::uint32_t files_ = 0;
};

/// Whether the whole text matches the pattern of '*', '?', '[a-z]' and '[!a-z]'; '\' takes the next byte as it is.
/// Goes by bytes whatever the locale, unlike the C library's, for which a name that is not UTF-8 matches nothing.
bool matchesGlob(std::string_view pattern, std::string_view text);

}  // namespace cindral
