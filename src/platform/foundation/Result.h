#pragma once

#include <optional>
#include <type_traits>
#include <utility>
#include <variant>

#include "platform/foundation/KsError.h"

namespace cindral {

/// A value of type T, or the error that kept it from being made.
///
/// Use TRY to pass an error on to the caller. Taking the value of an error aborts.
///
/// Thread safety: a value.
template <typename T>
class [[nodiscard]] Result {
public:
    using Value = T;

    Result(T value) : state_(std::in_place_index<0>, std::move(value)) {}        // NOLINT(google-explicit-constructor)
    Result(KsError error) : state_(std::in_place_index<1>, std::move(error)) {}  // NOLINT(google-explicit-constructor)

    template <typename U>
        requires(std::is_constructible_v<T, U&&> && !std::is_same_v<std::remove_cvref_t<U>, Result> &&
                 !std::is_same_v<std::remove_cvref_t<U>, KsError> && !std::is_same_v<std::remove_cvref_t<U>, T>)
    Result(U&& value)  // NOLINT(google-explicit-constructor)
        : state_(std::in_place_index<0>, std::forward<U>(value)) {}

    bool ok() const { return state_.index() == 0; }
    explicit operator bool() const { return ok(); }

    T& value() & { return std::get<0>(state_); }
    const T& value() const& { return std::get<0>(state_); }
    T&& value() && { return std::get<0>(std::move(state_)); }

    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }
    T&& operator*() && { return std::move(*this).value(); }
    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }

    const KsError& error() const& { return std::get<1>(state_); }
    KsError&& error() && { return std::get<1>(std::move(state_)); }

    T valueOr(T other) && { return ok() ? std::move(*this).value() : std::move(other); }

private:
    std::variant<T, KsError> state_;
};

/// Success without a value, or an error.
template <>
class [[nodiscard]] Result<void> {
public:
    using Value = void;

    Result() = default;
    Result(KsError error) : error_(std::move(error)) {}  // NOLINT(google-explicit-constructor)

    bool ok() const { return !error_.has_value(); }
    explicit operator bool() const { return ok(); }
    const KsError& error() const& { return *error_; }
    KsError&& error() && { return *std::move(error_); }
    void value() const {}

private:
    std::optional<KsError> error_;
};

}  // namespace cindral

#define CINDRAL_TRY(expression, result)       \
    __extension__({                           \
        auto result = (expression);           \
        if (!result.ok()) [[unlikely]]        \
            return std::move(result).error(); \
        std::move(result).value();            \
    })
#define CINDRAL_JOINED(a, b) a##b
#define CINDRAL_TRY_NUMBERED(expression, number) CINDRAL_TRY(expression, CINDRAL_JOINED(tryResult, number))

/// The value of a Result, or a return of its error from the enclosing function.
/// The statement expression is a compiler extension that both of our compilers have; the number lets one stand inside
/// another.
#define TRY(expression) CINDRAL_TRY_NUMBERED(expression, __COUNTER__)
