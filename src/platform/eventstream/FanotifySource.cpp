#include "platform/eventstream/FanotifySource.h"

#include <sys/fanotify.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

#include "platform/eventstream/FanotifyEvents.h"
#include "platform/eventstream/HintSender.h"
#include "platform/eventstream/WatchTable.h"
#include "platform/foundation/Sys.h"

// Headers of before Linux 5.17 don't have them.
#ifndef FAN_REPORT_TARGET_FID
#define FAN_REPORT_TARGET_FID 0x00001000
#endif
#ifndef FAN_RENAME
#define FAN_RENAME 0x10000000
#endif

namespace cindral {

namespace {

constexpr unsigned kGroup =
    FAN_CLASS_NOTIF | FAN_REPORT_DFID_NAME | FAN_REPORT_FID | FAN_UNLIMITED_QUEUE | FAN_UNLIMITED_MARKS | FAN_NONBLOCK;
constexpr std::uint64_t kEvents =
    FAN_CREATE | FAN_DELETE | FAN_MODIFY | FAN_ATTRIB | FAN_CLOSE_WRITE | FAN_DELETE_SELF | FAN_ONDIR;

// What readableBytes() counts for an event of any length.
constexpr std::uint64_t kCountedBytes = sizeof(fanotify_event_metadata);

class FanotifySource final : public EventSource {
public:
    FanotifySource(UniqueFd group, RenameRecords records) : group_(std::move(group)), records_(records) {}

    std::string_view name() const override { return "fanotify"; }
    Result<void> addRoot(int folder) override;
    Result<void> watchFolder(int folder, FileID fileID) override { return watch(folder, fileID); }
    Result<void> watchFile(int file, FileID fileID) override { return watch(file, fileID); }
    void forget(FileID fileID) override { watches_.remove(fileID); }
    Result<void> drain(const Receiver& receive) override;
    int pollDescriptor() const override { return group_.get(); }
    Usage usage() const override { return {.used = fileSystems_.size(), .limit = 0}; }

private:
    /// A marked file system, and a descriptor by which its objects can be opened.
    struct FileSystem {
        std::uint64_t identifier;
        UniqueFd mount;
    };

    Result<void> watch(int object, FileID fileID);
    std::uint64_t tellAll(ByteView events, HintSender& sender);
    void tell(const FanotifyEvent& event, HintSender& sender);
    bool tellEntry(const FanotifyEvent& event, const FanotifyEvent::Entry& entry, HintSender& sender);
    void tellObject(const FanotifyEvent& event, FileID fileID, HintSender& sender);
    void tellUnwatched(const FanotifyEvent::Object& object, HintSender& sender) const;

    UniqueFd group_;
    const RenameRecords records_;
    std::vector<FileSystem> fileSystems_;
    WatchTable watches_;           // By digest: a shared one costs a look too many, never one too few.
    std::vector<FileID> watched_;  // The objects of the record that is being told.
    alignas(fanotify_event_metadata) std::array<std::byte, kEventBufferBytes> buffer_;
};

Result<void> FanotifySource::addRoot(int folder) {
    const std::uint64_t identifier = TRY(sys::fileSystemID(folder));
    const auto isMarked = [&](const FileSystem& known) { return known.identifier == identifier; };
    if (std::ranges::any_of(fileSystems_, isMarked)) return {};
    TRY(sys::name_to_handle_at(folder, "", AT_EMPTY_PATH));  // Without handles no folder can be told from another.
    UniqueFd mount = TRY(sys::duplicate(folder));
    // A folder that is moved says so itself: without whole records nobody else names it.
    const std::uint64_t moves =
        records_ == RenameRecords::whole ? FAN_RENAME : FAN_MOVED_FROM | FAN_MOVED_TO | FAN_MOVE_SELF;
    TRY(sys::fanotify_mark(group_.get(), FAN_MARK_ADD | FAN_MARK_FILESYSTEM, kEvents | moves, folder));
    fileSystems_.push_back({.identifier = identifier, .mount = std::move(mount)});
    return {};
}

Result<void> FanotifySource::watch(int object, FileID fileID) {
    const FileHandle handle = TRY(sys::name_to_handle_at(object, "", AT_EMPTY_PATH));
    const FanotifyEvent::Object named{
        .fileSystem = TRY(sys::fileSystemID(object)), .handleType = handle.type, .handle = handle.view()};
    watches_.set(fileID, named.digest());
    return {};
}

void FanotifySource::tellObject(const FanotifyEvent& event, FileID fileID, HintSender& sender) {
    if ((event.mask & FAN_DELETE_SELF) == 0) return sender.object(fileID);
    watches_.remove(fileID);
    sender.lost(fileID);
}

/// Answers whether the folder is watched.
bool FanotifySource::tellEntry(const FanotifyEvent& event, const FanotifyEvent::Entry& entry, HintSender& sender) {
    watches_.find(entry.folder.digest(), watched_);
    for (const FileID folder : watched_) {
        if (entry.isFolderItself())
            tellObject(event, folder, sender);
        else
            sender.entry(folder, entry.name);
    }
    return !watched_.empty();
}

/// Of an object that an event names no place of, because it happened to the object alone: the number of its names
/// changed, or it was opened by its handle. It may be one of a watched folder.
void FanotifySource::tellUnwatched(const FanotifyEvent::Object& object, HintSender& sender) const {
    const auto at = std::ranges::find(fileSystems_, object.fileSystem, &FileSystem::identifier);
    if (at == fileSystems_.end()) return;
    FileHandle handle;
    handle.type = object.handleType;
    handle.size = static_cast<std::uint32_t>(object.handle.size());
    std::memcpy(handle.bytes, object.handle.data(), handle.size);
    const auto opened = sys::open_by_handle_at(at->mount.get(), handle, O_PATH);
    const auto status = opened.ok() ? sys::statx(opened->get(), "") : Result<FileStatus>(opened.error());
    if (status.ok()) return sender.object(FileID{status->fileID});
    // ESTALE: it is gone. EPERM: the process may not ask, and a file's first name outside stays unknown.
    const KsError& error = status.error();
    if (!error.isPosix(ESTALE) && !error.isPosix(ENOENT) && !error.isPosix(EPERM)) sender.overflow();
}

void FanotifySource::tell(const FanotifyEvent& event, HintSender& sender) {
    if ((event.mask & FAN_Q_OVERFLOW) != 0) return sender.overflow();
    bool told = false;
    for (std::size_t i = 0; i < event.entryCount; ++i) told |= tellEntry(event, event.entries[i], sender);
    if (!event.object) return;
    // Whoever looks at the entry sees the object, unless it is there no longer.
    if (told && (event.mask & (FAN_RENAME | FAN_DELETE)) == 0) return;
    watches_.find(event.object->digest(), watched_);
    for (const FileID fileID : watched_) tellObject(event, fileID, sender);
    const bool isGone = (event.mask & FAN_DELETE_SELF) != 0;
    if (watched_.empty() && event.entryCount == 0 && !isGone) tellUnwatched(*event.object, sender);
}

/// Answers the number of events.
std::uint64_t FanotifySource::tellAll(ByteView events, HintSender& sender) {
    std::uint64_t count = 0;
    while (!events.empty()) {
        const auto event = takeFanotifyEvent(events);
        ++count;
        if (!event) {
            sender.overflow();  // What can't be read may be of anything.
            break;
        }
        tell(*event, sender);
    }
    return count;
}

Result<void> FanotifySource::drain(const Receiver& receive) {
    // What waits now, and no more: who writes without a pause would never let it end.
    std::uint64_t left = TRY(sys::readableBytes(group_.get()));
    while (left > 0) {
        const auto size = sys::read(group_.get(), buffer_);
        if (!size.ok() && size.error().isPosix(EAGAIN)) return {};
        if (!size.ok()) return size.error();
        HintSender sender(receive);
        const std::uint64_t count = tellAll(ByteView(buffer_).first(*size), sender);
        left -= std::min(left, count * kCountedBytes);
    }
    return {};
}

}  // namespace

Result<std::unique_ptr<EventSource>> makeFanotifySourceOf(RenameRecords records) {
    const unsigned flags = records == RenameRecords::whole ? kGroup | FAN_REPORT_TARGET_FID : kGroup;
    UniqueFd group = TRY(sys::fanotify_init(flags, O_RDONLY));
    return std::unique_ptr<EventSource>(std::make_unique<FanotifySource>(std::move(group), records));
}

Result<std::unique_ptr<EventSource>> makeFanotifySource() {
    auto source = makeFanotifySourceOf(RenameRecords::whole);
    if (!source.ok() && source.error().isPosix(EINVAL)) return makeFanotifySourceOf(RenameRecords::halves);
    return source;
}

}  // namespace cindral
