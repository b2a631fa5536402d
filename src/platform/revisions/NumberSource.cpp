#include "platform/revisions/NumberSource.h"

#include <algorithm>
#include <cerrno>

namespace cindral {

namespace {

// What a process that is killed loses: of four thousand million document IDs, few enough; and what a listing gives
// before it goes to the disk again, which costs as much as listing a thousand files.
constexpr std::uint64_t kBlock = 65'536;

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
        TRY(reserve({std::min(end + kBlock, kEnd), reserved_.event}));
    }
    return static_cast<std::uint32_t>(next_.document);
}

Result<void> NumberSource::reserveAhead() {
    const MutexLock lock(mutex_);
    if (next_.document < reserved_.document || reserved_.document + kBlock > kLastDocumentID) return {};
    return reserve({reserved_.document + kBlock, reserved_.event});
}

std::uint32_t NumberSource::nextDocument() const {
    const MutexLock lock(mutex_);
    return static_cast<std::uint32_t>(next_.document);
}

void NumberSource::takeDocuments(std::size_t count) {
    const MutexLock lock(mutex_);
    next_.document += count;
}

std::uint64_t NumberSource::currentEvent() const {
    const MutexLock lock(mutex_);
    return next_.event - 1;
}

Result<std::uint64_t> NumberSource::reserveEvents(std::uint64_t count) {
    const MutexLock lock(mutex_);
    const std::uint64_t end = next_.event + count;
    if (end > reserved_.event) {
        TRY(reserve({reserved_.document, end + kBlock}));
    }
    return next_.event;
}

void NumberSource::takeEvents(std::uint64_t count) {
    const MutexLock lock(mutex_);
    next_.event += count;
}

Result<std::uint64_t> NumberSource::advanceEvent() {
    const std::uint64_t event = TRY(reserveEvents(1));
    takeEvents(1);
    return event;
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
