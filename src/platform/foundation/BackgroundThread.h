#pragma once

#include <functional>
#include <string_view>

namespace cindral {

/// Names the calling thread, cut to the kernel's 15 bytes.
void nameCurrentThread(std::string_view name);

/// Starts a thread that nobody joins. It gets none of the signals that are sent to the process: those are for the
/// host's own threads. Returns 0, or the errno value when there can't be another thread. An exception that leaves the
/// body ends the process.
int startBackgroundThread(std::function<void()> body);

}  // namespace cindral
