#include "host/HostVersion.h"

namespace cindral {

std::string_view hostVersion() {
    return CINDRAL_VERSION;
}

}  // namespace cindral
