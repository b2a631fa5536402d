#pragma once

namespace cindral {

/// Brings the app libraries up to date with the application registry, and signals the containers that changed. The
/// pacer's event.
///
/// No source of applications is connected: there is nothing to compare, and nothing is signalled.
void refreshApps();

}  // namespace cindral
