#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace cindral {

/// One type of a MimeTypes, by its place in it.
enum class MimeType : std::uint32_t {};

/// The types that a MIME database speaks of: their names, other names for them, and what they are kinds of.
///
/// Also holds the declared types, which have reverse-DNS names and no slash.
///
/// Thread safety: add first, by one thread; then read by any.
class MimeTypes {
public:
    /// The type of that name, made when it is not there.
    MimeType add(std::string_view name);
    /// Lines "other-name name". What a more important file said first holds.
    void addAliases(std::string_view text);
    /// Lines "type parent". What several files say adds up.
    void addSubclasses(std::string_view text);
    void addParent(MimeType type, MimeType parent);

    std::size_t size() const { return entries_.size(); }
    const std::string& name(MimeType type) const { return *entry(type).name; }
    /// The type itself, or the one that it is another name for.
    MimeType canonical(MimeType type) const { return entry(type).canonical; }

    /// Whether the type is the other, or a kind of it by what was added or by nature: every text type is a kind of
    /// "text/plain", and everything but "inode/…" a kind of "application/octet-stream".
    bool conforms(std::string_view type, std::string_view to) const;

private:
    struct Entry {
        const std::string* name;  ///< the key in types_, which never moves
        MimeType canonical;
        std::vector<MimeType> parents;
    };
    struct TextHash {
        using is_transparent = void;  // NOLINT(readability-identifier-naming): the library looks for it.
        std::size_t operator()(std::string_view text) const { return std::hash<std::string_view>{}(text); }
    };

    const Entry& entry(MimeType type) const { return entries_[static_cast<std::size_t>(type)]; }
    Entry& entry(MimeType type) { return entries_[static_cast<std::size_t>(type)]; }
    std::optional<MimeType> find(std::string_view name) const;
    bool walkConforms(MimeType from, std::string_view to) const;

    std::unordered_map<std::string, MimeType, TextHash, std::equal_to<>> types_;
    std::vector<Entry> entries_;
};

/// Whether the text can be the name of a media type: two parts and a slash, of visible characters.
bool isMediaTypeName(std::string_view text);

/// Calls `use` with each line, without its end. A last line that has no end counts.
template <typename Use>
void forEachLine(std::string_view text, Use use) {
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        use(text.substr(0, end));
        if (end == std::string_view::npos) return;
        text.remove_prefix(end + 1);
    }
}

}  // namespace cindral
