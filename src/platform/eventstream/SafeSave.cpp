#include "platform/eventstream/SafeSave.h"

#include <algorithm>
#include <array>
#include <cctype>

namespace cindral {

namespace {

constexpr std::array<std::string_view, 7> kBackupWords = {"bak", "backup", "old", "orig", "save", "sav", "prev"};

bool isDigits(std::string_view text) {
    return std::ranges::all_of(text, [](char c) { return c >= '0' && c <= '9'; });
}

bool isSeparator(char c) {
    return c == '.' || c == '_' || c == '-';
}

/// "bak", "BAK2", "orig~".
bool isBackupWord(std::string_view text) {
    if (text.ends_with('~')) text.remove_suffix(1);
    return std::ranges::any_of(kBackupWords, [text](std::string_view word) {
        const bool begins =
            text.size() >= word.size() && std::ranges::equal(text.substr(0, word.size()), word, [](char a, char b) {
                return std::tolower(static_cast<unsigned char>(a)) == b;
            });
        return begins && isDigits(text.substr(word.size()));
    });
}

/// "~", ".~3~", ".bak", "_old", ".20261121".
bool isBackupSuffix(std::string_view suffix) {
    if (suffix == "~" || suffix == "#") return true;
    if (suffix.starts_with(".~") && suffix.ends_with('~')) return isDigits(suffix.substr(2, suffix.size() - 3));
    if (!isSeparator(suffix.front())) return false;
    suffix.remove_prefix(1);
    return !suffix.empty() && (isDigits(suffix) || isBackupWord(suffix));
}

/// "~", ".~", "#", "bak.".
bool isBackupPrefix(std::string_view prefix) {
    if (prefix == "~" || prefix == "#" || prefix == ".~" || prefix == ".#" || prefix == "~$") return true;
    if (!isSeparator(prefix.back())) return false;
    prefix.remove_suffix(1);
    if (prefix.starts_with('.')) prefix.remove_prefix(1);
    return isBackupWord(prefix);
}

}  // namespace

bool isBackupName(std::string_view name, std::string_view original) {
    if (original.empty() || name.size() <= original.size()) return false;
    if (name.starts_with(original)) return isBackupSuffix(name.substr(original.size()));
    if (name.starts_with('#') && name.ends_with('#') && name.substr(1, name.size() - 2) == original) return true;
    return name.ends_with(original) && isBackupPrefix(name.substr(0, name.size() - original.size()));
}

void RecentDepartures::add(FileID folder, std::string_view name, DocumentID document, TimePoint now) {
    forgetOld(now);
    departures_.insert_or_assign({folder, std::string(name)}, Departure{document, now});
}

std::optional<DocumentID> RecentDepartures::take(FileID folder, std::string_view name, TimePoint now) {
    if (departures_.empty()) return std::nullopt;
    const auto found = departures_.find({folder, std::string(name)});
    if (found == departures_.end()) return std::nullopt;
    const Departure departure = found->second;
    departures_.erase(found);
    if (now - departure.at > kWindow) return std::nullopt;
    return departure.document;
}

void RecentDepartures::forgetFolder(FileID folder) {
    const auto first = departures_.lower_bound({folder, std::string()});
    auto last = first;
    while (last != departures_.end() && last->first.first == folder) ++last;
    departures_.erase(first, last);
}

void RecentDepartures::forgetOld(TimePoint now) {
    // Not at each call: a tree of a million documents that is removed adds them one by one.
    if (now - forgottenAt_ < kWindow) return;
    forgottenAt_ = now;
    std::erase_if(departures_, [now](const auto& entry) { return now - entry.second.at > kWindow; });
}

}  // namespace cindral
