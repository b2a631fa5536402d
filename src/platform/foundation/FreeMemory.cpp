#include "platform/foundation/FreeMemory.h"

#include <malloc.h>

// The sanitizers have a heap of their own; the C library's is never set up then, and must not be touched.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define CINDRAL_HAS_ANOTHER_HEAP
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define CINDRAL_HAS_ANOTHER_HEAP
#endif
#endif

namespace cindral {

void returnFreeMemory() {
#if defined(__GLIBC__) && !defined(CINDRAL_HAS_ANOTHER_HEAP)
    (void)::malloc_trim(0);
#endif
}

}  // namespace cindral
