#include "platform/revisions/NumberSource.h"

#include <algorithm>
#include <cerrno>

namespace cindral {

namespace {

// A block is as long as what was taken so far: a process that is killed loses at most as many IDs as it gave, or the
// least block, and one that gives a million goes to the disk twenty times.
constexpr std::uint64_t kBlockMin = 1024;
constexpr std::uint64_t kBlockMax = 65'536;

std::uint64_t blockAfter(std::uint64_t taken) {
    return std::clamp(taken, kBlockMin, kBlockMax);
}

}  // namespace

NumberSource::NumberSource(HighWaterFile file, const HighWaterMarks& next)
    : file_(std::move(file)), next_(next), reserved_(next) {}

Result<void> NumberSource::reserve(const HighWaterMarks& marks) {
    TRY(file_.write(marks));
    reserved_ = marks;
    return {};
}

Result<std::uint32_t> NumberSource::reserveDocuments(std::size_t count) {
    constexpr std::uint64_t kEnd = std::uint64_t{kLastDocumentID} + 1;
    const MutexLock lock(mutex_);
    const std::uint64_t end = next_.document + count;
    if (end > kEnd) return KsError::posix(ENOSPC).with("message", "every document ID has been given");
    if (end > reserved_.document) {
        TRY(reserve({std::min(end + blockAfter(documentsTaken_), kEnd), reserved_.event}));
    }
    return static_cast<std::uint32_t>(next_.document);
}

std::uint32_t NumberSource::nextDocument() const {
    const MutexLock lock(mutex_);
    return static_cast<std::uint32_t>(next_.document);
}

void NumberSource::takeDocuments(std::size_t count) {
    const MutexLock lock(mutex_);
    next_.document += count;
    documentsTaken_ += count;
}

std::uint64_t NumberSource::currentEvent() const {
    const MutexLock lock(mutex_);
    return next_.event - 1;
}

Result<std::uint64_t> NumberSource::advanceEvent() {
    const MutexLock lock(mutex_);
    if (next_.event == reserved_.event) {
        TRY(reserve({reserved_.document, reserved_.event + blockAfter(eventsTaken_)}));
    }
    ++eventsTaken_;
    return next_.event++;
}

HighWaterMarks NumberSource::reserved() const {
    const MutexLock lock(mutex_);
    return reserved_;
}

Result<void> NumberSource::repairFile() {
    const MutexLock lock(mutex_);
    if (file_.marks() == reserved_) return {};
    return reserve(reserved_);
}

Result<void> NumberSource::giveBackTheRest() {
    const MutexLock lock(mutex_);
    if (next_ == reserved_) return {};
    return reserve(next_);
}

}  // namespace cindral
