#include "platform/roster/RosterFiles.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

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
    // A handle first: what a name leads to is looked at before it is opened, so that no device ever is.
    const Result<UniqueFd> handle = openHandle(directory, path, links, 0);
    if (!handle.ok()) return std::nullopt;
    const Result<FileStatus> status = sys::statx(handle->get(), "");
    if (!status.ok() || !status->isRegular() || status->size > max) return std::nullopt;
    const Result<UniqueFd> file =
        sys::open(fmt::format("/proc/self/fd/{}", handle->get()).c_str(), O_RDONLY | O_NONBLOCK);
    if (!file.ok()) return std::nullopt;

    // One byte more than there should be, to see that the file has not grown beyond the limit meanwhile.
    Bytes bytes(max < status->size + 1 ? max + 1 : status->size + 1);
    std::size_t filled = 0;
    while (filled < bytes.size()) {
        const ssize_t got = ::read(file->get(), bytes.data() + filled, bytes.size() - filled);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) return std::nullopt;
        if (got == 0) break;
        filled += static_cast<std::size_t>(got);
        if (filled == bytes.size() && filled <= max) bytes.resize(std::min(max + 1, filled * 2));
    }
    if (filled > max) return std::nullopt;
    bytes.resize(filled);
    return bytes;
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
