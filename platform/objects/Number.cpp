#include "platform/objects/Number.h"

#include <cstdio>

namespace tamber {

Number::Number(Kind kind, uint64_t u, int64_t i, double d) : kind_(kind), u_(u), i_(i), d_(d) {}

std::shared_ptr<const Number> Number::fromUInt64(uint64_t v) {
    return std::shared_ptr<const Number>(new Number(Kind::Unsigned, v, 0, 0));
}
std::shared_ptr<const Number> Number::fromInt64(int64_t v) {
    return std::shared_ptr<const Number>(new Number(Kind::Signed, 0, v, 0));
}
std::shared_ptr<const Number> Number::fromDouble(double v) {
    return std::shared_ptr<const Number>(new Number(Kind::Floating, 0, 0, v));
}
std::shared_ptr<const Number> Number::fromBool(bool v) {
    // Immutable, and asked for several times per file a listing reads: two suffice.
    static const std::shared_ptr<const Number> kFalse(new Number(Kind::Boolean, 0, 0, 0));
    static const std::shared_ptr<const Number> kTrue(new Number(Kind::Boolean, 1, 0, 0));
    return v ? kTrue : kFalse;
}

uint64_t Number::uint64Value() const {
    switch (kind_) {
        case Kind::Unsigned:
        case Kind::Boolean:
            return u_;
        case Kind::Signed:
            return static_cast<uint64_t>(i_);
        case Kind::Floating:
            // Out-of-range conversions are undefined in C++; clamp instead.
            if (!(d_ >= 0))
                return 0;
            if (d_ >= 18446744073709551615.0)
                return UINT64_MAX;
            return static_cast<uint64_t>(d_);
    }
    return 0;
}

int64_t Number::int64Value() const {
    switch (kind_) {
        case Kind::Unsigned:
        case Kind::Boolean:
            return static_cast<int64_t>(u_);
        case Kind::Signed:
            return i_;
        case Kind::Floating:
            if (!(d_ == d_))
                return 0;
            if (d_ <= -9223372036854775808.0)
                return INT64_MIN;
            if (d_ >= 9223372036854775807.0)
                return INT64_MAX;
            return static_cast<int64_t>(d_);
    }
    return 0;
}

double Number::doubleValue() const {
    switch (kind_) {
        case Kind::Unsigned:
        case Kind::Boolean:
            return static_cast<double>(u_);
        case Kind::Signed:
            return static_cast<double>(i_);
        case Kind::Floating:
            return d_;
    }
    return 0;
}

bool Number::boolValue() const {
    switch (kind_) {
        case Kind::Unsigned:
        case Kind::Boolean:
            return u_ != 0;
        case Kind::Signed:
            return i_ != 0;
        case Kind::Floating:
            return d_ != 0;
    }
    return false;
}

std::string Number::description() const {
    switch (kind_) {
        case Kind::Unsigned:
            return std::to_string(u_);
        case Kind::Signed:
            return std::to_string(i_);
        case Kind::Boolean:
            return u_ ? "1" : "0";
        case Kind::Floating: {
            char buf[40];
            std::snprintf(buf, sizeof buf, "%.17g", d_);
            return buf;
        }
    }
    return {};
}

bool Number::isEqual(const Object& other) const {
    auto n = dynamic_cast<const Number*>(&other);
    if (!n)
        return false;
    if (n->kind_ == Kind::Floating || kind_ == Kind::Floating)
        return n->doubleValue() == doubleValue();
    if (n->kind_ == Kind::Signed && n->i_ < 0)
        return kind_ == Kind::Signed && i_ == n->i_;
    if (kind_ == Kind::Signed && i_ < 0)
        return false;
    return n->uint64Value() == uint64Value();
}

}  // namespace tamber
