#pragma once

#include <cassert>
#include <optional>
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
