#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/foundation/Result.h"
#include "platform/foundation/RootDirectories.h"

namespace cindral {

/// The storage's folder for what is not to stay.
inline constexpr std::string_view kTemporaryLocalFolderName = ".TemporaryLocalFolder";

/// A folder of one operation's own, in the temporary folder of a root: where things are built before they appear, and
/// where they go to be removed. From there to their place, and from their place there, it is one rename.
///
/// Named ".staging-", the process and a number, and locked (flock) for as long as it lives: a folder of that name
/// without a lock was left behind by a process that ended, and is nobody's any more. One that is kept is named
/// "kept-…" instead: what was moved there is not yet known to be somewhere else, or to be what was to be removed. It
/// outlasts its process when there is something in it, for people to look after.
///
/// Thread safety: for one thread at a time.
class StagingFolder {
public:
    /// The name of the one thing that is built or removed there.
    static constexpr const char* kItemName = "item";

    enum class Contents { mayGo, areKept };
    /// A new one on the root. The temporary folder is made where it is missing.
    static Result<std::unique_ptr<StagingFolder>> make(std::shared_ptr<const RootDirectory> root,
                                                       Contents contents = Contents::mayGo);
    /// Removes itself and what is left in it, unless that is kept. What can't be removed is logged, and left to
    /// removeAbandoned().
    ~StagingFolder();
    StagingFolder(const StagingFolder&) = delete;
    StagingFolder& operator=(const StagingFolder&) = delete;

    int fd() const { return fd_.get(); }
    const FileStatus& status() const { return status_; }
    /// As presented.
    std::string path() const;

    /// What is in it is no longer kept.
    Result<void> letGo();

    /// Removes the folders that processes left behind which ended in the middle of their work.
    static void removeAbandoned(const RootDirectory& root);

private:
    StagingFolder(std::shared_ptr<const RootDirectory> root, UniqueFd temporary, std::string name, Contents contents,
                  UniqueFd fd, const FileStatus& status);

    Result<void> rename(std::string_view prefix);

    const std::shared_ptr<const RootDirectory> root_;
    const UniqueFd temporary_;
    std::string name_;
    Contents contents_;
    const UniqueFd fd_;
    const FileStatus status_;
};

/// Opens the temporary folder of a root, making it where it is missing. What is there otherwise is an error: a link or
/// a file would lead elsewhere.
Result<UniqueFd> openTemporaryFolder(const RootDirectory& root);

}  // namespace cindral
