#include "platform/roster/PersonalChoices.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "platform/foundation/Files.h"
#include "platform/foundation/Sys.h"
#include "platform/roster/KeyFile.h"

namespace cindral {
namespace {

// Written to disk: never change one.
constexpr std::string_view kGroup = "Applications";
constexpr std::string_view kEnabled = "enabled";
constexpr std::string_view kDisabled = "disabled";

constexpr std::string_view kRosterErrorDomain = "CindralRosterErrorDomain";
constexpr std::int64_t kNoKeyFile = 1;

bool isPlain(char byte) {
    return (byte >= 'a' && byte <= 'z') || (byte >= 'A' && byte <= 'Z') || (byte >= '0' && byte <= '9') ||
           byte == '.' || byte == '-' || byte == '_';
}

std::string keyOf(const std::string& identifier) {
    std::string key;
    for (const char byte : identifier) {
        if (isPlain(byte)) {
            key += byte;
        } else {
            key += fmt::format("%{:02X}", static_cast<unsigned char>(byte));
        }
    }
    return key;
}

int digitOf(char byte) {
    if (byte >= '0' && byte <= '9') return byte - '0';
    if (byte >= 'A' && byte <= 'F') return byte - 'A' + 10;
    return -1;
}

std::optional<std::string> identifierOf(std::string_view key) {
    std::string identifier;
    for (std::size_t i = 0; i < key.size(); ++i) {
        if (isPlain(key[i])) {
            identifier += key[i];
            continue;
        }
        const int high = key[i] == '%' && i + 2 < key.size() ? digitOf(key[i + 1]) : -1;
        const int low = high >= 0 ? digitOf(key[i + 2]) : -1;
        if (low < 0) return std::nullopt;
        identifier += static_cast<char>(high * 16 + low);
        i += 2;
    }
    return identifier;
}

/// Held by who changes the file, from before it is read until it is replaced.
Result<UniqueFd> lockFolder(const std::string& folder) {
    UniqueFd fd = TRY(sys::open(folder.c_str(), O_RDONLY | O_DIRECTORY));
    while (::flock(fd.get(), LOCK_EX) != 0) {
        if (errno != EINTR) return KsError::posix(errno, folder);
    }
    return fd;
}

}  // namespace

std::string_view choiceName(PersonalChoices::Choice choice) {
    return choice == PersonalChoices::Choice::enabled ? kEnabled : kDisabled;
}

PersonalChoices::PersonalChoices(const KeyFile& file) {
    for (const std::string& key : file.keys(kGroup)) {
        const auto identifier = identifierOf(key);
        const std::string& value = *file.value(kGroup, key);
        if (!identifier) continue;
        if (value == kEnabled) choices_[*identifier] = Choice::enabled;
        if (value == kDisabled) choices_[*identifier] = Choice::disabled;
    }
}

Result<PersonalChoices> PersonalChoices::load(const std::string& path) {
    const Result<Bytes> bytes = files::readAll(path, KeyFile::kBytesMax);
    if (!bytes.ok() && bytes.error().isPosix(ENOENT)) return PersonalChoices();
    if (!bytes.ok()) return bytes.error().with("path", path);
    const std::optional<KeyFile> file = KeyFile::parse(textOf(*bytes));
    if (file) return PersonalChoices(*file);
    return KsError(kRosterErrorDomain, kNoKeyFile,
                   {{"message", "It holds lines that can't be read; mend it or take it away"}, {"path", path}});
}

PersonalChoices PersonalChoices::read(const std::string& path) {
    return load(path).valueOr(PersonalChoices());
}

std::optional<PersonalChoices::Choice> PersonalChoices::of(const std::string& identifier) const {
    const auto found = choices_.find(identifier);
    return found == choices_.end() ? std::nullopt : std::optional(found->second);
}

std::string PersonalChoices::text() const {
    std::string text =
        fmt::format("# Which applications' documents are published: cindral apps enable|disable.\n[{}]\n", kGroup);
    for (const auto& [identifier, choice] : choices_)
        text += fmt::format("{}={}\n", keyOf(identifier), choiceName(choice));
    return text;
}

Result<void> PersonalChoices::write(const std::string& path, const std::string& identifier, Choice choice) {
    const std::string folder = path.substr(0, path.rfind('/'));
    TRY(files::makeFolders(folder));
    const UniqueFd lock = TRY(lockFolder(folder));
    PersonalChoices choices = TRY(load(path));
    choices.choices_[identifier] = choice;
    return files::replace(path, bytesOf(choices.text()));
}

}  // namespace cindral
