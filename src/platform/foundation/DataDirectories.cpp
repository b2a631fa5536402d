#include "platform/foundation/DataDirectories.h"

#include <algorithm>
#include <cstdlib>
#include <string_view>

namespace cindral {

namespace {

std::string_view viewOf(const char* text) {
    return text == nullptr ? std::string_view() : std::string_view(text);
}

}  // namespace

std::vector<std::string> dataDirectories(const char* home, const char* dataHome, const char* dataDirs) {
    std::vector<std::string> directories;
    const auto add = [&](std::string path) {
        if (path.starts_with('/') && std::ranges::find(directories, path) == directories.end())
            directories.push_back(std::move(path));
    };

    if (viewOf(dataHome).starts_with('/')) {
        add(std::string(viewOf(dataHome)));
    } else if (!viewOf(home).empty()) {
        add(std::string(viewOf(home)) + "/.local/share");
    }
    std::string_view rest = viewOf(dataDirs);
    if (rest.empty()) rest = "/usr/local/share:/usr/share";
    while (!rest.empty()) {
        const std::size_t colon = std::min(rest.find(':'), rest.size());
        add(std::string(rest.substr(0, colon)));
        rest.remove_prefix(std::min(colon + 1, rest.size()));
    }
    return directories;
}

std::vector<std::string> dataDirectories() {
    return dataDirectories(std::getenv("HOME"), std::getenv("XDG_DATA_HOME"), std::getenv("XDG_DATA_DIRS"));
}

}  // namespace cindral
