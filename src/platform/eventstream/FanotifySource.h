#pragma once

#include <memory>

#include "platform/eventstream/EventSource.h"

namespace cindral {

/// What the kernel says of a rename. Linux 5.17 brought both names in one event, and the object itself beside its name.
enum class RenameRecords { whole, halves };

/// makeFanotifySource() for a kernel that has, or is treated as having, no more than that. EINVAL where it has less.
Result<std::unique_ptr<EventSource>> makeFanotifySourceOf(RenameRecords records);

}  // namespace cindral
