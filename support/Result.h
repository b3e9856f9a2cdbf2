#pragma once

#include <cassert>
#include <optional>
#include <type_traits>
#include <utility>
#include <variant>

#include "support/Error.h"
#include "support/Status.h"

namespace tamber {

// A value or an error; test it with ok() (no conversion to bool, like Status). The success
// type may be void-like through `Result<std::monostate>`.
template <class T>
class Result {
public:
    Result(T value) : v_(std::move(value)) {}      // NOLINT: implicit by design
    Result(Error error) : v_(std::move(error)) {}  // NOLINT
    // A value of a type that converts to T (a derived record for a base pointer, ...).
    template <class U>
    requires(std::is_convertible_v<U&&, T> && !std::is_same_v<std::decay_t<U>, T> &&
             !std::is_convertible_v<U&&, Error>) Result(U&& value)
        : v_(std::in_place_index<0>, T(std::forward<U>(value))) {}  // NOLINT
    // The result of a narrower type, value or error.
    template <class U>
    requires(std::is_convertible_v<const U&, T> && !std::is_same_v<U, T>)
        Result(const Result<U>& other)  // NOLINT
        : v_(other.ok() ? std::variant<T, Error>(std::in_place_index<0>, T(other.value()))
                        : std::variant<T, Error>(std::in_place_index<1>, other.error())) {}

    bool ok() const { return v_.index() == 0; }
    // The outcome without the value.
    Status status() const { return ok() ? Status() : Status(error()); }

    T& value() & {
        assert(ok());
        return std::get<0>(v_);
    }
    const T& value() const& {
        assert(ok());
        return std::get<0>(v_);
    }
    T&& value() && {
        assert(ok());
        return std::get<0>(std::move(v_));
    }
    const Error& error() const {
        assert(!ok());
        return std::get<1>(v_);
    }
    T* operator->() { return &value(); }
    const T* operator->() const { return &value(); }
    T& operator*() & { return value(); }
    const T& operator*() const& { return value(); }

private:
    std::variant<T, Error> v_;
};

}  // namespace tamber
