#include "provider/AppRefresh.h"

#include "platform/foundation/Log.h"

namespace cindral {

void refreshApps() {
    const LogSection section("pacer event");
}

}  // namespace cindral
