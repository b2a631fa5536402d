#pragma once

namespace cindral {

/// Gives what was freed back to the system. For after work that took much memory for a short time: the allocator keeps
/// what lies between allocations that stay, for good. A millisecond or so.
///
/// Thread safety: from any thread.
void returnFreeMemory();

}  // namespace cindral
