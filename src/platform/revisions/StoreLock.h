#pragma once

#include <string>

#include "platform/foundation/Result.h"
#include "platform/revisions/StoreFile.h"

namespace cindral {

/// Keeps a store to one process. Goes with the object, and with the process however it ends.
///
/// A program that this process starts doesn't inherit it; a forked copy that goes on without starting one does.
///
/// Thread safety: the caller's.
class StoreLock {
public:
    static constexpr const char* kName = "lock";

    StoreLock() = default;
    /// EBUSY with "holder" (the pid as text) and "path" when somebody has it already, be it this process.
    static Result<StoreLock> acquire(int folder, const std::string& folderPath);

    /// What the last holder left in the file: its note of leaving, or its pid when it could not.
    const std::string& noteOfLastHolder() const { return noteOfLastHolder_; }
    /// Left to the next holder instead of the pid.
    void leaveNote(const std::string& note);

private:
    StoreFile file_;
    std::string noteOfLastHolder_;
};

}  // namespace cindral
