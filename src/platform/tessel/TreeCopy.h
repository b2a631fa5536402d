#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <string>
#include <utility>

#include "platform/foundation/Result.h"
#include "platform/tessel/TesselProgress.h"
#include "platform/tessel/TreeWalk.h"

namespace cindral {

/// Modes of what nobody but the owner is to see: a copy until it is complete, and what holds it.
inline constexpr mode_t kPrivateFile = 0600;
inline constexpr mode_t kPrivateFolder = 0700;

/// What to do where the target's file system keeps no attributes.
enum class AttributeLoss { isLogged, isAnError };

/// Copies files and whole folders: data, times, modes, access lists and the user's attributes.
///
/// Data is shared with the source where the file system can, else copied in the kernel, else read and written; holes
/// stay holes. Links are copied as links, several names of one file within the tree stay names of one file, FIFOs and
/// devices are made anew and never opened. Nothing is left out: what can't be copied is an error. Owner and group are
/// those of the process, and bits that would lend them to others are dropped with the old ones.
///
/// Not a snapshot of a source that changes meanwhile.
///
/// Thread safety: for one thread at a time.
class TreeCopy {
public:
    struct Options {
        AttributeLoss attributeLoss = AttributeLoss::isLogged;
        /// A folder that is left out wherever it turns up: where the copy itself is built.
        const FileStatus* excluded = nullptr;
    };

    /// `progress` is borrowed for life. `path` is the source's, for errors.
    TreeCopy(TesselProgress& progress, std::string path, Options options)
        : progress_(progress), path_(std::move(path)), options_(options) {}

    /// Copies the entry into an entry that is not there yet. On an error the target may be there in part.
    Result<void> copy(int source, const char* name, int target, const char* targetName);
    /// Copies an open regular file into an empty one, attributes and all.
    Result<void> copyFile(int source, const FileStatus& status, int target);

private:
    class Visitor;
    struct ObjectKey {
        std::uint64_t device;
        std::uint64_t fileID;
        friend auto operator<=>(const ObjectKey&, const ObjectKey&) = default;
    };

    Result<void> copyEntry(int source, const char* name, int target, const char* targetName);
    Result<void> copyRegular(int handle, const FileStatus& status, int target, const char* targetName);
    Result<bool> linkToFirstName(const FileStatus& status, int target, const char* targetName);
    static Result<void> copyLink(int source, const char* name, const FileStatus& status, int target,
                                 const char* targetName);
    static Result<void> copyNode(const FileStatus& status, int target, const char* targetName);
    Result<void> copyData(int source, const FileStatus& status, int target);
    Result<void> copyExtents(int source, int target);
    Result<void> copyRange(int source, int target, std::uint64_t begin, std::uint64_t end);
    Result<void> copyByReading(int source, std::uint64_t size, int target, std::uint64_t begin, std::uint64_t end);
    Result<void> copyAttributes(int source, const FileStatus& status, int target);
    Result<void> copyAttribute(int source, const char* name, int target, mode_t mode);

    TesselProgress& progress_;
    const std::string path_;
    const Options options_;
    bool canClone_ = true;
    bool canCopyInKernel_ = true;
    bool hasLostAttributes_ = false;
    UniqueFd top_;            ///< the copy's top folder, once there is one
    std::string folderPath_;  ///< of the folder that is being filled, below the top, with a slash at its end
    /// Where a file with several names was copied to first, below the top.
    std::map<ObjectKey, std::string> firstNames_;
    std::vector<std::byte> buffer_;
};

/// Counts what there is to copy: the entry and everything below it, and the bytes of regular files.
///
/// ECANCELED when the progress was cancelled meanwhile.
Result<void> measureTree(int directory, const char* name, const std::string& path, const FileStatus* excluded,
                         TesselProgress& progress);

enum class Thoroughness { contents, stamps };
/// Whether the copy is what the source is now: the same things under the same names, the same contents (or, by stamps,
/// sizes and modification times alone). EIO with the "path" of the first difference.
Result<void> compareTrees(int source, const char* name, int copy, const char* copyName, const std::string& path,
                          Thoroughness thoroughness, const TesselProgress* progress);

}  // namespace cindral
