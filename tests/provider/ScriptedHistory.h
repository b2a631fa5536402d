#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/eventstream/EventHistory.h"
#include "platform/foundation/Mutex.h"

namespace cindral::test {

/// An event history whose every event the test says.
class ScriptedHistory : public EventHistory {
public:
    explicit ScriptedHistory(KsUUID uuid) : uuid_(uuid) {}

    /// The event's ID, the next one where it has none, and tells the observers.
    std::uint64_t add(Event event) { return add(paths_, std::move(event)); }
    std::uint64_t addDocument(Event event) { return add(documents_, std::move(event)); }
    /// Forgets what was up to the event.
    void trim(std::uint64_t eventID) {
        const MutexLock lock(mutex_);
        begin_ = eventID;
    }
    void setCurrent(std::uint64_t eventID) {
        const MutexLock lock(mutex_);
        current_ = eventID;
    }
    /// Called by each drain, before it is done.
    void onDrain(std::function<Result<void>()> block) {
        const MutexLock lock(mutex_);
        onDrain_ = std::move(block);
    }
    /// Called by each reading of path events.
    void onRead(std::function<void()> block) {
        const MutexLock lock(mutex_);
        onRead_ = std::move(block);
    }
    int drains() const {
        const MutexLock lock(mutex_);
        return drains_;
    }
    std::size_t observers() const {
        const MutexLock lock(mutex_);
        return observers_.size();
    }

    KsUUID volumeUUID() const override { return uuid_; }
    std::uint64_t currentEventID() const override {
        const MutexLock lock(mutex_);
        return current_;
    }
    Result<void> drain() override {
        std::function<Result<void>()> block;
        {
            const MutexLock lock(mutex_);
            ++drains_;
            block = onDrain_;
        }
        return block ? block() : Result<void>();
    }
    bool canReplayAfter(std::uint64_t eventID) const override {
        const MutexLock lock(mutex_);
        return eventID >= begin_ && eventID <= current_;
    }
    Result<Batch> pathEvents(std::uint64_t after, std::size_t max) const override {
        std::function<void()> block;
        {
            const MutexLock lock(mutex_);
            block = onRead_;
        }
        if (block) block();
        return read(paths_, after, max);
    }
    Result<Batch> documentEvents(std::uint64_t after, std::size_t max) const override {
        return read(documents_, after, max);
    }
    std::uint64_t addObserver(std::function<void()> observer) override {
        const MutexLock lock(mutex_);
        observers_[++lastObserver_] = std::move(observer);
        return lastObserver_;
    }
    void removeObserver(std::uint64_t observer) override {
        const MutexLock lock(mutex_);
        observers_.erase(observer);
    }

private:
    std::uint64_t add(std::vector<Event>& events, Event event) {
        std::map<std::uint64_t, std::function<void()>> observers;
        std::uint64_t id = 0;
        {
            const MutexLock lock(mutex_);
            if (event.id == 0) event.id = current_ + 1;
            id = current_ = event.id;
            events.push_back(std::move(event));
            observers = observers_;
        }
        for (const auto& [number, observer] : observers) observer();
        return id;
    }
    Result<Batch> read(const std::vector<Event>& events, std::uint64_t after, std::size_t max) const {
        const MutexLock lock(mutex_);
        Batch batch;
        for (const Event& event : events) {
            if (event.id <= after) continue;
            if (batch.events.size() == max) {
                batch.upTo = batch.events.back().id;
                return batch;
            }
            batch.events.push_back(event);
        }
        batch.upTo = current_;
        batch.isLast = true;
        return batch;
    }

    const KsUUID uuid_;
    mutable Mutex mutex_;
    std::vector<Event> paths_ GUARDED_BY(mutex_);
    std::vector<Event> documents_ GUARDED_BY(mutex_);
    std::uint64_t begin_ GUARDED_BY(mutex_) = 0;
    std::uint64_t current_ GUARDED_BY(mutex_) = 1000;
    int drains_ GUARDED_BY(mutex_) = 0;
    std::function<Result<void>()> onDrain_ GUARDED_BY(mutex_);
    std::function<void()> onRead_ GUARDED_BY(mutex_);
    std::map<std::uint64_t, std::function<void()>> observers_ GUARDED_BY(mutex_);
    std::uint64_t lastObserver_ GUARDED_BY(mutex_) = 0;
};

}  // namespace cindral::test
