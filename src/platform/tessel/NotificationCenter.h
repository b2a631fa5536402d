#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/foundation/Mutex.h"

namespace cindral {

/// Names of the application registry's notifications.
inline constexpr std::string_view kApplicationRegisteredNotification = "com.vemra.Roster.applicationRegistered";
inline constexpr std::string_view kApplicationUnregisteredNotification = "com.vemra.Roster.applicationUnregistered";

/// What happens to posts while deliveries are suspended.
enum class SuspensionBehavior { drop, coalesce, deliverImmediately };

/// Posts named notifications to whoever asked for them, within the process.
///
/// An observer is a token, an address that the centre never looks behind: who registers keeps what is at the address
/// alive for as long as the callback may need it. Callbacks run on the thread that posts (or resumes), in the order of
/// registration. removeEveryObserver() returns when no callback with that token is running any more, unless it is
/// called from one. Callbacks may use the centre; two that remove each other's tokens at the same time wait for ever.
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

    /// While suspended, posts wait as their observers asked; resuming delivers what was kept, once a registration for
    /// `coalesce`.
    void suspend();
    void resume();

private:
    struct Registration {
        const void* observer;
        Callback callback;
        std::string name;
        SuspensionBehavior behavior;
        bool postedWhileSuspended = false;  ///< kept for resume()
        bool isRemoved = false;
    };
    /// Shared with the posts that are delivering it, which a removal does not wait for when it is part of one.
    using Registrations = std::vector<std::shared_ptr<Registration>>;
    /// A callback that is running.
    struct Delivery {
        const void* observer;
        std::thread::id thread;
    };

    /// Whether a post reaches the registration now; otherwise it is kept or dropped, as the observer asked.
    bool reachesNow(Registration& registration) REQUIRES(mutex_);
    void deliver(const Registrations& registrations) EXCLUDES(mutex_);
    bool beginDelivery(const Registration& registration) EXCLUDES(mutex_);
    void endDelivery(const void* observer) EXCLUDES(mutex_);

    Mutex mutex_;
    Condition delivered_;
    bool isSuspended_ GUARDED_BY(mutex_) = false;
    Registrations registrations_ GUARDED_BY(mutex_);  ///< in the order in which they came
    std::vector<Delivery> deliveries_ GUARDED_BY(mutex_);
};

}  // namespace cindral
