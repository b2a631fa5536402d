#include "platform/roster/RosterWatch.h"

#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "platform/foundation/Log.h"

namespace cindral {
namespace {

constexpr std::uint32_t kNameChanges =
    IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR | IN_MASK_ADD;
constexpr std::uint32_t kContentChanges = IN_CLOSE_WRITE | IN_MODIFY | IN_ATTRIB;
constexpr std::uint32_t kOwnChanges = IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED | IN_UNMOUNT | IN_Q_OVERFLOW;

/// Whether the file was whole when its name came: a link, or a further name of a file.
bool cameWhole(const std::string& path) {
    struct stat status;
    return ::lstat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode) || status.st_nlink > 1;
}

}  // namespace

Result<RosterWatch> RosterWatch::make() {
    UniqueFd fd(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!fd) return KsError::errorWithPOSIXCode();
    return RosterWatch(std::move(fd));
}

bool RosterWatch::watch(const RosterInterests& interests) {
    std::map<int, Folder> before = std::move(folders_);
    folders_.clear();
    isComplete_ = true;
    bool isNew = false;
    for (const auto& [path, interest] : interests) {
        const std::uint32_t mask = kNameChanges | (interest.isContents ? kContentChanges : 0);
        const int watch = ::inotify_add_watch(fd_.get(), path.c_str(), mask);
        if (watch < 0) {
            // What is not there, or may not be read, comes to notice in the folder above.
            if (errno != ENOSPC && errno != ENOMEM) continue;
            isComplete_ = false;
            if (!hasSaidLimit_) logError("can't watch {} for applications; {}", path, errnoText(errno));
            hasSaidLimit_ = true;
            continue;
        }
        // Two paths may lead to one folder.
        const auto [found, isFirst] = folders_.try_emplace(watch, Folder{path, interest});
        if (!isFirst) {
            found->second.interest.names.insert(interest.names.begin(), interest.names.end());
            found->second.interest.isEveryName |= interest.isEveryName;
            found->second.interest.isContents |= interest.isContents;
        }
        const auto known = before.find(watch);
        isNew |= known == before.end() || (interest.isContents && !known->second.interest.isContents);
    }
    for (const auto& [watch, folder] : before) {
        // Fails when the folder is gone, and its watch with it.
        if (!folders_.contains(watch)) (void)::inotify_rm_watch(fd_.get(), watch);
    }
    return isNew;
}

bool RosterWatch::drain(TimePoint now) {
    bool isNews = false;
    alignas(inotify_event) char buffer[16'384];
    while (true) {
        const ssize_t size = ::read(fd_.get(), buffer, sizeof buffer);
        if (size < 0 && errno == EINTR) continue;
        if (size <= 0) break;
        for (const char* at = buffer; at < buffer + size;) {
            const auto* event = reinterpret_cast<const inotify_event*>(at);
            isNews |= take(*event, now);
            at += sizeof *event + event->len;
        }
    }
    for (auto each = lastWrites_.begin(); each != lastWrites_.end();) {
        if (now - each->second < kQuiet) {
            ++each;
            continue;
        }
        filesBeingWritten_.erase(each->first);
        each = lastWrites_.erase(each);
        isNews = true;
    }
    return isNews;
}

bool RosterWatch::take(const inotify_event& event, TimePoint now) {
    if ((event.mask & IN_Q_OVERFLOW) != 0) {
        // Who closed which file may be among what was lost.
        filesBeingWritten_.clear();
        lastWrites_.clear();
        return true;
    }
    const auto found = folders_.find(event.wd);
    if (found == folders_.end()) return false;
    if ((event.mask & kOwnChanges) != 0) return true;
    if (event.len == 0) return false;
    const auto& [path, interest] = found->second;
    const std::string name(event.name);
    if (interest.isContents && (event.mask & IN_ISDIR) == 0) return takeContents(event, path + "/" + name, now);
    return (event.mask & (IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO)) != 0 &&
           (interest.isEveryName || interest.names.contains(name));
}

bool RosterWatch::takeContents(const inotify_event& event, const std::string& path, TimePoint now) {
    if ((event.mask & (IN_CLOSE_WRITE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO)) != 0) {
        noteWritten(path);
        return true;
    }
    if ((event.mask & IN_CREATE) != 0 && cameWhole(path)) return true;
    if ((event.mask & (IN_CREATE | IN_MODIFY)) != 0) {
        noteWriting(path, now);
        return false;
    }
    return true;  // Its attributes: it may have become readable.
}

void RosterWatch::noteWriting(const std::string& path, TimePoint now) {
    filesBeingWritten_.insert(path);
    lastWrites_[path] = now;
}

void RosterWatch::noteWritten(const std::string& path) {
    filesBeingWritten_.erase(path);
    lastWrites_.erase(path);
}

std::optional<RosterWatch::TimePoint> RosterWatch::nextMoment() const {
    if (lastWrites_.empty()) return std::nullopt;
    return std::ranges::min_element(lastWrites_, {}, [](const auto& each) { return each.second; })->second + kQuiet;
}

}  // namespace cindral
