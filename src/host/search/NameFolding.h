#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace cindral {

/// Names as a search sees them: without case, without diacritics, without differences of form that nobody types.
///
/// docs/search-index.md has the rules. Folding is the same for the names that are indexed and for what is looked for,
/// and folding twice changes nothing more.
namespace name_folding {

/// Any bytes will do; what is not UTF-8 becomes U+FFFD. No "/" is in what comes back.
std::string fold(std::string_view name);

/// What has to be the same for texts folded at different times to be comparable.
std::string version();

}  // namespace name_folding

/// How a name holds what was looked for, best first. Part of the pages that clients keep for a while.
enum class NameMatch : std::uint8_t { prefix = 0, word = 1, substring = 2 };

/// None where the name does not hold the text. Both folded. A word begins at a letter or digit that follows something
/// else.
std::optional<NameMatch> nameMatchOf(std::string_view name, std::string_view text);

/// What a name is found by: each three characters that follow one another; with a "/" before them, the first one and two
/// of the name; with a "/" behind them, the first one and two of each later word. One and two characters by themselves
/// only where one is not ASCII: there are scripts in which that is a word, while letters of this one are in most names.
namespace name_grams {

using Receiver = std::function<bool(std::string_view gram)>;
/// Calls back for each, some of them twice, until the receiver answers false. Whether it never did.
bool forEach(std::string_view folded, const Receiver& receiver);

/// What every name holds that matches the text in this way; not every name that holds them matches. For a text that is
/// not empty. Nothing for a part of a name that is too short to be found by.
std::vector<std::string> required(std::string_view text, NameMatch match);

}  // namespace name_grams

}  // namespace cindral
