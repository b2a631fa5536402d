#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <utility>

#include "platform/foundation/Dispatch.h"

namespace cindral {

/// Waits for the value of a completion, for a caller that has nothing else to do. One completion, one wait().
///
/// Thread safety: the completion may be called on any thread.
template <typename Value>
class Awaited {
public:
    std::function<void(Value)> completion() {
        return [state = state_](Value value) {
            state->value = std::move(value);
            state->done.signal();
        };
    }
    Value wait() {
        state_->done.wait();
        return *std::move(state_->value);
    }

private:
    // Shared, because who waits may be gone before the signal's call has returned.
    struct State {
        DispatchSemaphore done{0};
        std::optional<Value> value;
    };
    std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace cindral
