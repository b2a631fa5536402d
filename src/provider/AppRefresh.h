#pragma once

#include <functional>

namespace cindral {

/// Brings the app libraries up to date with the application registry, and signals the containers that changed. The
/// pacer's event: one at a time.
///
/// `refreshed` is called in between: the list is up to date, and nobody has been signalled.
void refreshApps(const std::function<void()>& refreshed);

}  // namespace cindral
