#include "platform/foundation/FreeMemory.h"

#include <malloc.h>

namespace cindral {

void returnFreeMemory() {
#ifdef __GLIBC__
    (void)::malloc_trim(0);
#endif
}

}  // namespace cindral
