#pragma once

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace cindral {

/// A text of named groups of keys and values: the form of desktop entries, of Flatpak's metadata and configuration, and
/// of our own list of people's choices.
///
/// A line is blank, a comment ("#…"), the head of a group ("[NAME]") or "KEY=VALUE"; a text with any other line, with a
/// value before the first group, or with a NUL is no key file: a file that is only partly written mostly is none. Groups
/// of one name are one; of several values of a key, the last counts.
///
/// Thread safety: a value.
class KeyFile {
public:
    /// Bytes that are worth looking at. A desktop entry with a hundred translations has about twenty thousand.
    static constexpr std::size_t kBytesMax = 1'048'576;

    /// None for a text that is no key file, or has more than kBytesMax.
    static std::optional<KeyFile> parse(std::string_view text);

    bool hasGroup(std::string_view group) const { return groups_.contains(group); }
    std::vector<std::string> groups() const;
    std::vector<std::string> keys(std::string_view group) const;
    /// As it stands, without the blanks around it.
    const std::string* value(std::string_view group, std::string_view key) const;
    /// With its escapes (\s \n \t \r \\) undone; a backslash before anything else stands for itself.
    std::optional<std::string> string(std::string_view group, std::string_view key) const;
    /// None for what is neither "true" nor "false".
    std::optional<bool> boolean(std::string_view group, std::string_view key) const;
    /// The value for the first of the locales (localeNames()) that the key has one for, else the one for all.
    std::optional<std::string> localizedString(std::string_view group, std::string_view key,
                                               const std::vector<std::string>& locales) const;

private:
    using Group = std::map<std::string, std::string, std::less<>>;
    std::map<std::string, Group, std::less<>> groups_;
};

/// What keys of a key file may say in brackets for people of a locale ("sr_YU.UTF-8@Latn"), best first: with country and
/// modifier, with the country, with the modifier, the language alone. None for "C" and "POSIX".
std::vector<std::string> localeNames(std::string_view locale);

}  // namespace cindral
