#include "platform/foundation/Fatal.h"

#include <cstdlib>

#include "platform/foundation/Log.h"

namespace cindral {

void fatal(std::string_view message) {
    log::write(LogLevel::error, message);
    std::abort();
}

}  // namespace cindral
