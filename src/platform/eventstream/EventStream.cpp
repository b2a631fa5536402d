#include "platform/eventstream/EventStream.h"

#include <cerrno>

#include "platform/revisions/RvStorageManager.h"

namespace cindral {

std::uint64_t EventStream::currentEventID() {
    const auto store = RvStorageManager::defaultManager().store();
    return store ? store->currentEventID() : 0;
}

std::optional<KsUUID> EventStream::volumeUUID(const KsURL& url) {
    const auto store = RvStorageManager::defaultManager().store();
    const Result<FileStatus> status = url.status();
    if (!store || !status.ok() || !RootDirectories::shared().isPublishedDevice(status->device)) return std::nullopt;
    return store->uuid();
}

Result<std::uint64_t> EventStream::noteChange() {
    const auto store = RvStorageManager::defaultManager().store();
    if (!store) return KsError::posix(EAGAIN);
    return store->advanceEventID();
}

}  // namespace cindral
