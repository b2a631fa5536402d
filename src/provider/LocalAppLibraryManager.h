#pragma once

#include <vector>

#include "platform/foundation/KsURL.h"

namespace cindral {

/// What the conversion of identifiers asks of the app libraries.
///
/// Thread safety: all operations, from any thread.
struct CdlAppLibraryManager {
    /// The root of every app library, in no particular order. No source of applications is connected: there are none.
    static std::vector<KsURL> rootURLsForAppLibraries() { return {}; }
};

}  // namespace cindral
