#include "platform/tessel/NotificationCenter.h"

#include <algorithm>
#include <utility>

#include "platform/foundation/ThreadPool.h"

namespace cindral {

NotificationCenter* NotificationCenter::distributedCenter() {
    static NotificationCenter& center = *new NotificationCenter;
    return &center;
}

void NotificationCenter::addObserver(const void* observer, Callback callback, std::string_view name,
                                     SuspensionBehavior behavior) {
    auto registration = std::make_shared<Registration>(Registration{observer, callback, std::string(name), behavior});
    const MutexLock lock(mutex_);
    registrations_.push_back(std::move(registration));
}

void NotificationCenter::removeEveryObserver(const void* observer) {
    const ThreadPool::BlockingRegion region;
    const auto thread = std::this_thread::get_id();
    const MutexLock lock(mutex_);
    std::erase_if(registrations_, [&](const auto& registration) {
        if (registration->observer != observer) return false;
        registration->isRemoved = true;
        return true;
    });
    // Two callbacks of one token that both remove it must not wait for each other.
    const auto isOurs = [&](const Delivery& delivery) {
        return delivery.observer == observer && delivery.thread == thread;
    };
    if (std::ranges::any_of(deliveries_, isOurs)) return;
    while (std::ranges::find(deliveries_, observer, &Delivery::observer) != deliveries_.end()) delivered_.wait(mutex_);
}

void NotificationCenter::post(std::string_view name) {
    Registrations reached;
    {
        const MutexLock lock(mutex_);
        for (const auto& registration : registrations_) {
            if (registration->name == name && reachesNow(*registration)) reached.push_back(registration);
        }
    }
    deliver(reached);
}

bool NotificationCenter::reachesNow(Registration& registration) {
    if (!isSuspended_) return true;
    switch (registration.behavior) {
        case SuspensionBehavior::drop: return false;
        case SuspensionBehavior::coalesce: registration.postedWhileSuspended = true; return false;
        case SuspensionBehavior::deliverImmediately: return true;
    }
    return false;
}

void NotificationCenter::suspend() {
    const MutexLock lock(mutex_);
    isSuspended_ = true;
}

void NotificationCenter::resume() {
    Registrations kept;
    {
        const MutexLock lock(mutex_);
        isSuspended_ = false;
        for (const auto& registration : registrations_) {
            if (std::exchange(registration->postedWhileSuspended, false)) kept.push_back(registration);
        }
    }
    deliver(kept);
}

void NotificationCenter::deliver(const Registrations& registrations) {
    for (const auto& registration : registrations) {
        if (!beginDelivery(*registration)) continue;
        registration->callback(registration->observer, registration->name);
        endDelivery(registration->observer);
    }
}

/// False when the registration was removed since it was picked.
bool NotificationCenter::beginDelivery(const Registration& registration) {
    const MutexLock lock(mutex_);
    if (registration.isRemoved) return false;
    deliveries_.push_back({registration.observer, std::this_thread::get_id()});
    return true;
}

void NotificationCenter::endDelivery(const void* observer) {
    const auto thread = std::this_thread::get_id();
    const MutexLock lock(mutex_);
    const auto ended = std::ranges::find_if(deliveries_, [&](const Delivery& delivery) {
        return delivery.observer == observer && delivery.thread == thread;
    });
    deliveries_.erase(ended);
    delivered_.notifyAll();
}

}  // namespace cindral
