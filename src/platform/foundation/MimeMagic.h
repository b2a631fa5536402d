#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <unordered_set>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/foundation/MimeTypes.h"

namespace cindral {

/// Types by the first bytes of files: the rules of the MIME database's "magic" files (docs/type-database.md).
///
/// Thread safety: add first, by one thread; then find by any.
class MimeMagic {
public:
    /// No rule that needs more of a file is kept.
    static constexpr std::size_t kContentBytesMax = 64 * 1024;

    /// Adds the sections of one file, most important file first. A rule that is malformed is passed over with
    /// what is below it; a file that doesn't begin as it should is passed over whole.
    void add(ByteView file, MimeTypes& types);

    /// Type of the first section that matches, by priority, then importance of the file, then order in the file.
    std::optional<MimeType> find(ByteView beginning) const;

    /// Bytes that find() can make use of.
    std::size_t contentBytesMax() const { return contentBytesMax_; }

private:
    class Reader;
    struct Line;
    /// `length` bytes that stand, under a mask, at one of `range` places from `offset` on.
    struct Rule {
        std::uint32_t offset = 0;
        std::uint32_t range = 1;
        std::size_t length = 0;
        std::size_t value = 0;  ///< in bytes_; the mask follows, if there is one
        bool isMasked = false;
        bool hasChildren = false;  ///< one of them has to match as well, even when none of them could be kept
        std::size_t end = 0;       ///< the first rule that is not below this one
    };
    struct Section {
        int priority = 0;
        MimeType type{};
        std::size_t begin = 0;  ///< in rules_
        std::size_t end = 0;
    };

    bool addRules(Reader& reader);
    void addRule(const Line& line);
    void closeRules(std::vector<std::size_t>& open, std::size_t count);
    bool anyMatches(std::size_t begin, std::size_t end, ByteView beginning) const;
    bool matches(const Rule& rule, ByteView beginning) const;
    bool matchesAt(const Rule& rule, const std::byte* place) const;

    std::vector<Section> sections_;  ///< in the order in which they are tried
    std::vector<Rule> rules_;
    Bytes bytes_;
    std::unordered_set<std::uint32_t> closed_;  ///< types that take no rules from less important files
    std::size_t contentBytesMax_ = 0;
};

}  // namespace cindral
