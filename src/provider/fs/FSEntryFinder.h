#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// An entry below some directories, as a deep listing of them would come upon it.
struct FSFoundEntry {
    enum class Standing {
        reached,  ///< a deep listing delivers it
        outside,  ///< none does: it is below a package, a folder that can't be read, or what was mounted from elsewhere
        missing,  ///< nothing is there
    };
    Standing standing = Standing::missing;
    /// Where it was reached: with its open directory, and its status known.
    std::optional<KsURL> url;
};

/// Finds single entries below some directories by their paths, on the way that a deep listing takes: from directory to
/// directory, never by a link, not into packages and other devices, and only where the directories can be read.
///
/// The directories on the way stay open, so that what is looked for together is found at the cost of its own status.
/// What is known of them holds until forget().
///
/// Thread safety: one thread at a time.
class FSEntryFinder {
public:
    explicit FSEntryFinder(std::vector<KsURL> urls);

    /// `path` as presented. Outside of the directories, and the directories themselves, are `missing`. An error says
    /// that it can't be told: the process lacks descriptors or memory, or the disk failed.
    Result<FSFoundEntry> find(std::string_view path);
    /// What find() would answer of an entry with the status, a file without extended attributes in a folder of that ID,
    /// where it is known to be listed; without a look at it. None where that can't be told.
    std::optional<KsURL> foundAlready(std::string_view path, FileID folder, const FileStatus& status);
    /// Directories may have moved: what is asked next is looked for anew.
    void forget();

private:
    /// A directory on the way, open where it is `reached`.
    struct Folder {
        FSFoundEntry::Standing standing = FSFoundEntry::Standing::missing;
        std::shared_ptr<const DirectoryReference> directory;
    };
    Result<Folder> folder(const KsURL& top, std::string_view path);
    static Result<Folder> openTop(const KsURL& top);
    static Result<Folder> openChild(const std::shared_ptr<const DirectoryReference>& parent, std::string_view name,
                                    std::string path);

    const std::vector<KsURL> urls_;
    std::unordered_map<std::string, Folder> folders_;
    std::unordered_map<std::string, std::shared_ptr<const DirectoryReference>> unopened_;
};

/// The innermost of the directories that the path is strictly below; null when it is below none.
const KsURL* directoryHolding(const std::vector<KsURL>& urls, std::string_view path);
/// Whether the path is the folder's or below it, by whole components and in its proper form.
bool isAtOrBelow(std::string_view path, std::string_view folder);

}  // namespace cindral
