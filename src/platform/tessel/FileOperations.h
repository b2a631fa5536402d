#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/Sys.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

// NOLINTBEGIN(readability-identifier-naming): the prefix says that an operation of the framework is called.

/// Bytes of the regular files in a directory and below it. Links are not followed and other devices not entered; what
/// can't be read counts as nothing. POSIX error when the directory itself can't be opened.
Result<std::uint64_t> ts_directorySize(const KsURL& directory);

/// The edits of files. Each happens wholly or not at all: an error means that everything is as it was, and a process
/// that ends at any instruction leaves files as they were or as they should be, and otherwise only what
/// StagingFolder::removeAbandoned() clears away. (Of a move to another device an ended process may leave both: the whole
/// source and the whole copy.)
///
/// - No name that is taken is ever taken over: that a name is taken is said by the call that would take it, never by a
///   look before. The error is 516 of the general domain, with the URL of what is in the way (ts_collidingURL).
/// - A name is not empty, "." or "..", and has no "/" and no NUL (EINVAL), and at most 255 bytes (ENAMETOOLONG).
/// - A root, a folder that holds one, and the storage's temporary folder are not moved, renamed, trashed or deleted, and
///   nothing is made outside of the roots: error 513 of the general domain.
/// - What is not there is error 260 of the general domain; everything else that the file system refuses is its POSIX
///   error. Errors bear the "path" that they are about.
/// - Everything is reached from the descriptor of its root: no link, swapped at any moment, leads an operation outside.
///
/// The functions with a completion do their work on a thread of the shared pool and call back there, once.
///
/// Thread safety: all operations, from any thread, at the same time.
using FileOperationCompletion = std::function<void(Result<KsURL>)>;
using FileDeletionCompletion = std::function<void(std::optional<KsError>)>;

/// What an edit is about: a place, and the object that was found there.
///
/// Between the look and the edit somebody else may move the object away and put another in its place: that one is left
/// alone, and the error is ESTALE. Without an object whatever is there is meant.
///
/// Edits of this process keep out of each other's way. Another program can still swap the object in the microsecond
/// between the last look and the call that moves or deletes it; what it put there is moved or deleted then. For
/// deletions, Certainty shuts it out.
struct MeantFile {
    MeantFile(KsURL place, std::optional<ObjectIdentity> found = std::nullopt)  // NOLINT(google-explicit-constructor)
        : url(std::move(place)), object(found) {}

    KsURL url;
    std::optional<ObjectIdentity> object;
};

/// Copies a file or a whole folder, from anywhere, into the folder, under the name that it has. See TreeCopy.
///
/// It appears in one step, complete. EINVAL for a folder that holds the target. The progress, here and below, is the one
/// that was passed.
std::shared_ptr<TesselProgress> ts_importUnderFolder(
    const KsURL& source, const MeantFile& folder, FileOperationCompletion completion,
    std::shared_ptr<TesselProgress> progress = std::make_shared<TesselProgress>());
void ts_createSubFolder(const MeantFile& folder, std::string name, FileOperationCompletion completion);
void ts_renameWithNewName(const MeantFile& file, std::string newName, FileOperationCompletion completion);
/// Moves into the folder; without a name, under the name that it has. Already being there under that name is success.
///
/// To another device it is copied, compared, and only then removed; that alone makes progress and can be cancelled.
/// EINVAL for a folder that is to go into itself.
std::shared_ptr<TesselProgress> ts_reparentUnderFolder(
    const MeantFile& file, const MeantFile& folder, std::optional<std::string> newName,
    FileOperationCompletion completion, std::shared_ptr<TesselProgress> progress = std::make_shared<TesselProgress>());
enum class Bouncing { isRefused, isAllowed };
/// With bouncing, a name that is taken makes it take a free one: alternativeName().
std::shared_ptr<TesselProgress> ts_reparentUnderFolder(
    const MeantFile& file, const MeantFile& folder, Bouncing bouncing, FileOperationCompletion completion,
    std::shared_ptr<TesselProgress> progress = std::make_shared<TesselProgress>());
/// Moves into the trash folder, which must be there, under the name that it has; never to another device (EXDEV).
void ts_trashUnderFolder(const MeantFile& file, const KsURL& trashFolder, FileOperationCompletion completion);
/// What a deletion may cost. A file is looked at once more and deleted with the next call; `isWanted` takes it out of
/// sight as folders are, looks at it there and then removes it, which takes four times as long. Where there is no room
/// for that (a full disk, a storage that is read-only) it does without.
enum class Certainty { isNotWanted, isWanted };
/// Deletes a file, or a folder and everything in it.
///
/// That all of a folder can be deleted is looked at first; until then it can be cancelled. Then it vanishes in one step,
/// and only the time that takes is still to pass: an error on the way is logged, and what is left is out of sight.
std::shared_ptr<TesselProgress> ts_deleteWithCompletionHandler(
    const MeantFile& file, FileDeletionCompletion completion,
    std::shared_ptr<TesselProgress> progress = std::make_shared<TesselProgress>(),
    Certainty certainty = Certainty::isNotWanted);

/// The same as plain functions, on the caller's thread.
namespace file_operations {

Result<KsURL> importUnderFolder(const KsURL& source, const MeantFile& folder, TesselProgress& progress);
Result<KsURL> createSubFolder(const MeantFile& folder, const std::string& name);
Result<KsURL> rename(const MeantFile& file, const std::string& newName);
Result<KsURL> reparent(const MeantFile& file, const MeantFile& folder, const std::optional<std::string>& newName,
                       Bouncing bouncing, TesselProgress& progress);
Result<KsURL> trash(const MeantFile& file, const KsURL& trashFolder);
Result<void> remove(const MeantFile& file, TesselProgress& progress, Certainty certainty = Certainty::isNotWanted);

/// Makes the folder unless it is there. What is there otherwise is an error: a link or a file would lead elsewhere.
Result<void> makeFolderUnlessThere(const KsURL& folder);

}  // namespace file_operations

/// EINVAL or ENAMETOOLONG for what is no name of a file.
Result<void> ts_checkName(std::string_view name);

/// What is in the way, of an error that says that a name is taken; none for any other error.
std::optional<KsURL> ts_collidingURL(const KsError& error);

/// Opens the object to be written to, whatever it is, without opening its contents: the descriptor takes attributes.
Result<void> ts_withReadWriteAccess(const MeantFile& file, const std::function<Result<void>(int fd)>& body);

// NOLINTEND(readability-identifier-naming)

}  // namespace cindral
