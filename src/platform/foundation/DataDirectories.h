#pragma once

#include <string>
#include <vector>

namespace cindral {

/// The folders that hold data of installed programs, most important first: the user's own, then the system's.
///
/// The arguments are values of HOME, XDG_DATA_HOME and XDG_DATA_DIRS; null or empty is unset. A relative path would
/// name another folder wherever the program is started, and counts as not there.
std::vector<std::string> dataDirectories(const char* home, const char* dataHome, const char* dataDirs);
/// Of this process's environment.
std::vector<std::string> dataDirectories();

}  // namespace cindral
