#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <string_view>

#include "platform/foundation/Mutex.h"

#include <vector>

namespace cindral {

/// Names of the application registry's notifications.
inline constexpr std::string_view kApplicationRegisteredNotification = "com.vemra.Roster.applicationRegistered";
inline constexpr std::string_view kApplicationUnregisteredNotification = "com.vemra.Roster.applicationUnregistered";

/// What happens to posts while deliveries are suspended.
enum class SuspensionBehavior { drop, coalesce, deliverImmediately };

/// Posts named notifications to whoever asked for them, within the process.
///
/// An observer is a token, an address that the centre never looks behind: who registers keeps what is at the address alive for as long
/// as the callback may need it. Callbacks run on the thread that posts (or resumes), in the order of registration.
/// removeEveryObserver() returns when no callback with that token is running any more, unless it is called from one.
///
/// Thread safety: all operations, from any thread.
class NotificationCenter {
public:
    using Callback = void (*)(const void* observer, std::string_view name);

    /// The centre that registry notifications are posted to. Never null on this platform; the pointer is the contract.
    static NotificationCenter* distributedCenter();

    void addObserver(const void* observer, Callback callback, std::string_view name, SuspensionBehavior behavior);
    void removeEveryObserver(const void* observer);
    void post(std::string_view name);

    /// While suspended, posts wait as their observers asked; resuming delivers what was kept, once a name for `coalesce`.
    void suspend();
    void resume();

private:
    struct Registration {
        const void* observer;
        Callback callback;
        std::string name;
        SuspensionBehavior behavior;
        bool postedWhileSuspended = false;
    };
    void deliver(const Registration& registration);

    Mutex mutex_;
    Condition delivered_;
    bool suspended_ GUARDED_BY(mutex_) = false;
    std::vector<Registration> registrations_ GUARDED_BY(mutex_);
    std::vector<const void*> delivering_ GUARDED_BY(mutex_);
};

}  // namespace cindral
