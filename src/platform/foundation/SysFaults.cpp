#include "platform/foundation/SysFaults.h"

#include <cerrno>
#include <utility>

namespace cindral::sys {

bool detail::askFaultSource(const char* call) {
    const int reason = (*faultSource)(call);
    if (reason == 0) return false;
    errno = reason;
    return true;
}

FaultInjection::FaultInjection(FaultSource source) : source_(std::move(source)), before_(detail::faultSource) {
    detail::faultSource = &source_;
}

FaultInjection::~FaultInjection() {
    detail::faultSource = before_;
}

}  // namespace cindral::sys
