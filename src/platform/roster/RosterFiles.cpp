#include "platform/roster/RosterFiles.h"

#include <fcntl.h>

#include <algorithm>

#include "platform/foundation/Files.h"
#include "platform/foundation/Sys.h"

namespace cindral {

namespace roster_files {

namespace {

Result<UniqueFd> openHandle(int directory, const std::string& path, Links links, int flags) {
    if (links == Links::beneath) return sys::openBeneath(directory, path, O_PATH | flags);
    return sys::openat(directory, path.c_str(), O_PATH | flags);
}

}  // namespace

std::optional<UniqueFd> openFolder(int directory, const std::string& path, Links links) {
    Result<UniqueFd> opened = openHandle(directory, path, links, O_DIRECTORY);
    if (!opened.ok()) return std::nullopt;
    return *std::move(opened);
}

std::optional<Bytes> read(int directory, const std::string& path, std::size_t max, Links links) {
    const Result<UniqueFd> handle = openHandle(directory, path, links, 0);
    if (!handle.ok()) return std::nullopt;
    Result<Bytes> bytes = files::readAll(handle->get(), max);
    if (!bytes.ok()) return std::nullopt;
    return *std::move(bytes);
}

std::optional<KeyFile> readKeyFile(int directory, const std::string& path, Links links) {
    const std::optional<Bytes> bytes = read(directory, path, KeyFile::kBytesMax, links);
    return bytes ? KeyFile::parse(textOf(*bytes)) : std::nullopt;
}

std::vector<std::string> names(int directory) {
    std::vector<std::string> names;
    const Result<UniqueFd> opened = sys::openDirectoryForReading(directory, ".");
    if (!opened.ok()) return names;
    alignas(8) std::byte buffer[16'384];
    while (true) {
        const Result<std::size_t> size = sys::getdents(opened->get(), buffer);
        if (!size.ok() || *size == 0) break;
        for (std::size_t at = 0; at < *size;) {
            const auto* record = reinterpret_cast<const DirectoryRecord*>(buffer + at);
            if (record->name[0] != '.') names.emplace_back(record->name);
            at += record->length;
        }
    }
    std::ranges::sort(names);
    return names;
}

}  // namespace roster_files

std::vector<PathStep> stepsOf(std::string_view path) {
    std::vector<PathStep> steps;
    std::size_t at = 0;
    while (at < path.size()) {
        const std::size_t begin = path.find_first_not_of('/', at);
        if (begin == std::string_view::npos) break;
        const std::size_t end = std::min(path.find('/', begin), path.size());
        std::string_view folder = path.substr(0, begin);
        while (folder.size() > 1 && folder.ends_with('/')) folder.remove_suffix(1);
        steps.push_back({std::string(folder), std::string(path.substr(begin, end - begin))});
        at = end;
    }
    return steps;
}

}  // namespace cindral
