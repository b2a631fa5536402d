#include "platform/foundation/InternedString.h"

#include <unordered_set>

#include "platform/foundation/Mutex.h"

namespace cindral {

const std::string InternedString::kEmpty;

InternedString::InternedString(std::string_view text) {
    if (text.empty()) return;
    // Never freed: an interned text may be read while the process ends.
    static Mutex& mutex = *new Mutex;
    static auto& texts = *new std::unordered_set<std::string>;  // Node-based: a text never moves.
    const MutexLock lock(mutex);
    text_ = &*texts.emplace(text).first;
}

}  // namespace cindral
