#pragma once

#include <string>

namespace CLI {
class App;
}

namespace cindral {

/// What shells and manuals are told of the program's words. All of it is made from the description that reads those
/// words, so that none of it can say something else.
///
/// The shells that completionText() knows.
inline constexpr const char* kCompletionShells[] = {"bash", "zsh", "fish"};

/// The names of all commands by what they are for, and the options that all of them have: at most 24 lines of 80
/// columns.
std::string screenHelp(const CLI::App& app);

/// The manual page, in the language of man(7).
std::string manualText(const CLI::App& app, const std::string& version);

/// What makes a shell complete the program's words; empty for a shell that is not known.
std::string completionText(const CLI::App& app, const std::string& shell);

}  // namespace cindral
