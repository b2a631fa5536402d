#pragma once

#include <functional>

namespace cindral::sys {

/// Asked before each system call that the calling thread makes through sys::, with the call's name. Answers the errno
/// that the call is to fail with instead of being made; 0 lets it be made.
using FaultSource = std::function<int(const char* call)>;

namespace detail {
inline constinit thread_local const FaultSource* faultSource = nullptr;
/// Whether the call is to fail; sets errno.
bool askFaultSource(const char* call);
}  // namespace detail

inline bool isToFail(const char* call) {
    return detail::faultSource != nullptr && detail::askFaultSource(call);
}

/// Puts the disk's faults under a test's control: while it lives, the calling thread's system calls ask the source.
///
/// Thread safety: of one thread, whose calls alone it sees.
class FaultInjection {
public:
    explicit FaultInjection(FaultSource source);
    ~FaultInjection();
    FaultInjection(const FaultInjection&) = delete;
    FaultInjection& operator=(const FaultInjection&) = delete;

private:
    const FaultSource source_;
    const FaultSource* const before_;
};

}  // namespace cindral::sys
