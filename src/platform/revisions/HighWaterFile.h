#pragma once

#include <cstdint>
#include <optional>

#include "platform/foundation/Data.h"
#include "platform/revisions/StoreFile.h"

namespace cindral {

/// The first numbers that were never reserved; whatever is below may have been given to somebody.
struct HighWaterMarks {
    std::uint64_t document = 1;
    std::uint64_t event = 1;

    friend bool operator==(const HighWaterMarks&, const HighWaterMarks&) = default;
    static HighWaterMarks highest(const HighWaterMarks& a, const HighWaterMarks& b);
};

/// The file that keeps numbers from being given twice, whatever happens to the database beside it.
///
/// Both of its slots are written, one after the other, before a number below a mark is given, so that a power cut
/// tears at most one of them and damage has to hit two blocks. Format: docs/volume-store.md.
///
/// Thread safety: the caller's.
class HighWaterFile {
public:
    static constexpr const char* kName = "ids";

    /// The marks are none when the file is new or neither of its slots is good.
    static Result<HighWaterFile> open(int folder);

    const std::optional<HighWaterMarks>& marks() const { return marks_; }
    /// On the disk, in both slots, when it returns. Marks are lowered only to give back what was reserved and never
    /// given.
    Result<void> write(const HighWaterMarks& marks);

private:
    HighWaterFile(StoreFile file, std::optional<HighWaterMarks> marks) : file_(std::move(file)), marks_(marks) {}
    StoreFile file_;
    std::optional<HighWaterMarks> marks_;
};

/// The higher marks of the slots that are good. Any bytes may be passed.
std::optional<HighWaterMarks> decodeHighWaterFile(ByteView bytes);
/// One slot.
Bytes encodeHighWaterSlot(const HighWaterMarks& marks);

}  // namespace cindral
