#pragma once

#include <cassert>
#include <optional>
#include <utility>

#include "support/Error.h"

namespace tamber {

// The outcome of an operation with no value: success, or the error that stopped it. Test it
// with ok(); there is deliberately no conversion to bool, so that a status and a Result read
// the same way at every call site.
class Status {
public:
    Status() = default;
    Status(Error error) : error_(std::move(error)) {}  // NOLINT: implicit by design

    static Status OK() { return Status(); }

    bool ok() const { return !error_.has_value(); }
    const Error& error() const {
        assert(!ok());
        return *error_;
    }

private:
    std::optional<Error> error_;
};

}  // namespace tamber
