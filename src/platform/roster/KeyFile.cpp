#include "platform/roster/KeyFile.h"

#include <algorithm>

namespace cindral {
namespace {

constexpr std::string_view kBlanks = " \t";

std::string_view withoutBlanks(std::string_view text) {
    text.remove_prefix(std::min(text.find_first_not_of(kBlanks), text.size()));
    return text.substr(0, text.find_last_not_of(kBlanks) + 1);
}

std::string_view takeLine(std::string_view& text) {
    const std::size_t end = text.find('\n');
    std::string_view line = text.substr(0, end);
    text.remove_prefix(end == std::string_view::npos ? text.size() : end + 1);
    if (line.ends_with('\r')) line.remove_suffix(1);
    return withoutBlanks(line);
}

std::string unescaped(std::string_view value) {
    std::string out;
    out.reserve(value.size());
    for (std::size_t i = 0; i < value.size(); ++i) {
        const char next = value[i] == '\\' && i + 1 < value.size() ? value[i + 1] : '\0';
        switch (next) {
            case 's': out += ' '; break;
            case 'n': out += '\n'; break;
            case 't': out += '\t'; break;
            case 'r': out += '\r'; break;
            case '\\': out += '\\'; break;
            default: out += value[i]; continue;
        }
        ++i;
    }
    return out;
}

}  // namespace

std::optional<KeyFile> KeyFile::parse(std::string_view text) {
    if (text.size() > kBytesMax || text.find('\0') != std::string_view::npos) return std::nullopt;
    KeyFile file;
    Group* group = nullptr;
    while (!text.empty()) {
        const std::string_view line = takeLine(text);
        if (line.empty() || line.starts_with('#')) continue;
        if (line.starts_with('[')) {
            if (!line.ends_with(']')) return std::nullopt;
            group = &file.groups_[std::string(line.substr(1, line.size() - 2))];
            continue;
        }
        const std::size_t equals = line.find('=');
        if (group == nullptr || equals == std::string_view::npos || equals == 0) return std::nullopt;
        group->insert_or_assign(std::string(withoutBlanks(line.substr(0, equals))),
                                std::string(withoutBlanks(line.substr(equals + 1))));
    }
    return file;
}

std::vector<std::string> KeyFile::groups() const {
    std::vector<std::string> names;
    for (const auto& [name, group] : groups_) names.push_back(name);
    return names;
}

std::vector<std::string> KeyFile::keys(std::string_view group) const {
    std::vector<std::string> names;
    const auto found = groups_.find(group);
    if (found == groups_.end()) return names;
    for (const auto& [name, value] : found->second) names.push_back(name);
    return names;
}

const std::string* KeyFile::value(std::string_view group, std::string_view key) const {
    const auto found = groups_.find(group);
    if (found == groups_.end()) return nullptr;
    const auto value = found->second.find(key);
    return value == found->second.end() ? nullptr : &value->second;
}

std::optional<std::string> KeyFile::string(std::string_view group, std::string_view key) const {
    const std::string* found = value(group, key);
    if (found == nullptr) return std::nullopt;
    return unescaped(*found);
}

std::optional<bool> KeyFile::boolean(std::string_view group, std::string_view key) const {
    const std::string* found = value(group, key);
    if (found == nullptr || (*found != "true" && *found != "false")) return std::nullopt;
    return *found == "true";
}

std::optional<std::string> KeyFile::localizedString(std::string_view group, std::string_view key,
                                                    const std::vector<std::string>& locales) const {
    std::string name;
    for (const std::string& locale : locales) {
        name.assign(key).append("[").append(locale).append("]");
        if (auto found = string(group, name)) return found;
    }
    return string(group, key);
}

std::vector<std::string> localeNames(std::string_view locale) {
    const std::size_t at = std::min(locale.find('@'), locale.size());
    const std::string modifier(locale.substr(at));
    locale = locale.substr(0, at);
    locale = locale.substr(0, locale.find('.'));
    const std::size_t underscore = std::min(locale.find('_'), locale.size());
    const std::string language(locale.substr(0, underscore));
    const std::string country(locale.substr(underscore));
    if (language.empty() || language == "C" || language == "POSIX") return {};

    std::vector<std::string> names;
    if (!country.empty() && !modifier.empty()) names.push_back(language + country + modifier);
    if (!country.empty()) names.push_back(language + country);
    if (!modifier.empty()) names.push_back(language + modifier);
    names.push_back(language);
    return names;
}

}  // namespace cindral
