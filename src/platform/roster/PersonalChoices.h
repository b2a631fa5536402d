#pragma once

#include <map>
#include <optional>
#include <string>

#include "platform/foundation/Result.h"

namespace cindral {

class KeyFile;

/// Whether a person lets an application's documents be published, where they said so. Counts like the application's own
/// keys, and before them.
///
/// A key file with one group, "Applications": the key is an application's identifier, with every byte but letters,
/// digits, ".", "-" and "_" as %XX; the value "enabled" or "disabled".
///
/// Thread safety: a value.
class PersonalChoices {
public:
    enum class Choice { enabled, disabled };

    PersonalChoices() = default;

    /// What the file says. A missing file says nothing, and neither does one that is no key file.
    static PersonalChoices read(const std::string& path);
    /// Writes one choice into the file, for its owner alone, keeping the others; the folders that lead to it are made.
    /// Two writers wait for each other, and a reader sees the file before or after, never between.
    ///
    /// A file that can't be read, or is no key file, is left as it is: the choices in it would be lost. The error has
    /// its "path".
    static Result<void> write(const std::string& path, const std::string& identifier, Choice choice);

    std::optional<Choice> of(const std::string& identifier) const;

private:
    explicit PersonalChoices(const KeyFile& file);
    static Result<PersonalChoices> load(const std::string& path);
    std::string text() const;

    std::map<std::string, Choice> choices_;
};

/// "enabled", "disabled".
std::string_view choiceName(PersonalChoices::Choice choice);

}  // namespace cindral
