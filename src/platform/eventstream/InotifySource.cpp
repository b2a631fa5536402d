#include <sys/inotify.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <cstring>
#include <optional>
#include <unordered_set>

#include "platform/eventstream/EventSource.h"
#include "platform/eventstream/HintSender.h"
#include "platform/eventstream/WatchTable.h"
#include "platform/foundation/Sys.h"

namespace cindral {

namespace {

// Events of an unlinked file count (no IN_EXCL_UNLINK): a file made without a name and then linked goes by its unlinked
// name for as long as its writer has it open. The end of a watch (IN_IGNORED) is told without being asked for.
constexpr std::uint32_t kOfContents = IN_MODIFY | IN_ATTRIB | IN_CLOSE_WRITE | IN_MOVE_SELF;
constexpr std::uint32_t kOfEntries = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO;

// The use of watches is asked for with every answer; how many there may be changes once in a machine's life.
constexpr std::chrono::milliseconds kLimitIsGood{500};

/// The number in a file of one; 0 where there is none.
std::uint64_t numberInFile(const char* path) {
    const auto file = sys::open(path, O_RDONLY);
    if (!file.ok()) return 0;
    std::array<std::byte, 32> text;
    const std::size_t size = sys::read(file->get(), text).valueOr(0);
    const auto* digits = reinterpret_cast<const char*>(text.data());
    std::uint64_t number = 0;
    std::from_chars(digits, digits + size, number);
    return number;
}

class InotifySource final : public EventSource {
public:
    explicit InotifySource(UniqueFd instance) : instance_(std::move(instance)) {}

    std::string_view name() const override { return "inotify"; }
    Result<void> addRoot(int) override { return {}; }
    Result<void> watchFolder(int folder, FileID fileID) override {
        return watch(folder, fileID, kOfEntries | kOfContents | IN_ONLYDIR);
    }
    Result<void> watchFile(int file, FileID fileID) override { return watch(file, fileID, kOfContents); }
    void forget(FileID fileID) override {
        if (const auto watch = watches_.remove(fileID)) end(*watch);
    }
    Result<void> drain(const Receiver& receive) override;
    int pollDescriptor() const override { return instance_.get(); }
    Usage usage() const override;

private:
    Result<void> watch(int object, FileID fileID, std::uint32_t mask);
    void end(std::uint64_t watch);
    void tell(const inotify_event& event, HintSender& sender);

    UniqueFd instance_;
    WatchTable watches_;
    mutable std::optional<std::chrono::steady_clock::time_point> limitReadAt_;
    mutable std::uint64_t limit_ = 0;
    // Ended by us, and events of theirs may still wait; the last of them is IN_IGNORED. Numbers come in a circle, so
    // that after two thousand million watches a new one may have one of these.
    std::unordered_set<int> ended_;
    std::vector<FileID> watched_;  // The objects of the event that is being told.
    alignas(inotify_event) std::array<std::byte, kEventBufferBytes> buffer_;
};

Result<void> InotifySource::watch(int object, FileID fileID, std::uint32_t mask) {
    const int watch = TRY(sys::inotify_add_watch(instance_.get(), object, mask));
    // Another watch under the file ID was of an earlier object that had the number.
    if (const auto earlier = watches_.set(fileID, static_cast<std::uint64_t>(watch))) end(*earlier);
    return {};
}

void InotifySource::end(std::uint64_t watch) {
    if (watches_.contains(watch)) return;
    const int number = static_cast<int>(watch);
    // Refused when the object is gone, and its watch with it.
    if (sys::inotify_rm_watch(instance_.get(), number).ok()) ended_.insert(number);
}

void InotifySource::tell(const inotify_event& event, HintSender& sender) {
    if ((event.mask & IN_Q_OVERFLOW) != 0) {
        ended_.clear();  // Their last events may be among those that were lost.
        sender.overflow();
        return;
    }
    const bool isLast = (event.mask & IN_IGNORED) != 0;
    if (ended_.contains(event.wd)) {
        if (isLast) ended_.erase(event.wd);
        return;
    }
    watches_.find(static_cast<std::uint64_t>(event.wd), watched_);
    // strnlen: the name is padded with zeros.
    const std::string_view name(event.name, event.len == 0 ? 0 : ::strnlen(event.name, event.len));
    for (const FileID fileID : watched_) {
        if (isLast) {
            watches_.remove(fileID);
            sender.lost(fileID);
        } else if (!name.empty()) {
            sender.entry(fileID, name);
        } else if ((event.mask & IN_UNMOUNT) == 0) {
            sender.object(fileID);
        }
    }
}

Result<void> InotifySource::drain(const Receiver& receive) {
    // What waits now, and no more: who writes without a pause would never let it end.
    std::uint64_t left = TRY(sys::readableBytes(instance_.get()));
    while (left > 0) {
        const std::size_t size = TRY(sys::read(instance_.get(), buffer_));
        HintSender sender(receive);
        for (std::size_t at = 0; at < size;) {
            const auto& event = *reinterpret_cast<const inotify_event*>(buffer_.data() + at);
            at += sizeof event + event.len;
            tell(event, sender);
        }
        left -= std::min<std::uint64_t>(left, size);
    }
    return {};
}

EventSource::Usage InotifySource::usage() const {
    const auto now = std::chrono::steady_clock::now();
    if (!limitReadAt_ || now - *limitReadAt_ > kLimitIsGood) {
        const std::uint64_t ofUser = numberInFile("/proc/sys/fs/inotify/max_user_watches");
        const std::uint64_t ofNamespace = numberInFile("/proc/sys/user/max_inotify_watches");
        limit_ = ofUser != 0 && ofNamespace != 0 ? std::min(ofUser, ofNamespace) : ofUser + ofNamespace;
        limitReadAt_ = now;
    }
    return {.used = watches_.size(), .limit = limit_};
}

}  // namespace

Result<std::unique_ptr<EventSource>> makeInotifySource() {
    UniqueFd instance = TRY(sys::inotify_init1(IN_NONBLOCK));
    return std::unique_ptr<EventSource>(std::make_unique<InotifySource>(std::move(instance)));
}

}  // namespace cindral
