#include "platform/tessel/FileOperations.h"

#include <fcntl.h>
#include <linux/openat2.h>

#include <string>
#include <vector>

#include "platform/foundation/Sys.h"

namespace cindral {

Result<std::uint64_t> ts_directorySize(const KsURL& directory) {
    const UniqueFd top = TRY(directory.open(O_PATH | O_DIRECTORY));
    const std::uint64_t device = TRY(sys::statx(top.get(), "")).device;
    std::uint64_t bytes = 0;
    alignas(8) std::byte buffer[16'384];
    // Folders wait as paths, not as descriptors: a deep tree must not use them up.
    std::vector<std::string> folders{""};
    while (!folders.empty()) {
        const std::string folder = std::move(folders.back());
        folders.pop_back();
        const Result<UniqueFd> fd = sys::openDirectoryBeneath(top.get(), folder, RESOLVE_NO_SYMLINKS | RESOLVE_NO_XDEV);
        if (!fd.ok()) continue;
        while (true) {
            const Result<std::size_t> size = sys::getdents(fd->get(), buffer);
            if (!size.ok() || *size == 0) break;
            for (std::size_t at = 0; at < *size;) {
                const auto* entry = reinterpret_cast<const DirectoryRecord*>(buffer + at);
                at += entry->length;
                if (entry->isDots()) continue;
                const Result<FileStatus> status = sys::statx(fd->get(), entry->name);
                if (!status.ok() || status->device != device) continue;
                if (status->isRegular()) bytes += status->size;
                if (status->isDirectory()) folders.push_back(folder.empty() ? entry->name : folder + "/" + entry->name);
            }
        }
    }
    return bytes;
}

}  // namespace cindral
