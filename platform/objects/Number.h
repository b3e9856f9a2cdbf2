#pragma once

#include <cstdint>

#include "platform/objects/Object.h"

namespace tamber {

// A number that remembers what it holds, so that archives round-trip it exactly.
class Number : public Object {
public:
    enum class Kind { Unsigned, Signed, Floating, Boolean };
    static constexpr std::string_view kClassName = "Number";

    static std::shared_ptr<const Number> fromUInt64(uint64_t v);
    static std::shared_ptr<const Number> fromInt64(int64_t v);
    static std::shared_ptr<const Number> fromDouble(double v);
    static std::shared_ptr<const Number> fromBool(bool v);

    Kind kind() const { return kind_; }
    // Conversions as C would do them.
    uint64_t uint64Value() const;
    int64_t int64Value() const;
    double doubleValue() const;
    bool boolValue() const;

    std::string_view className() const override { return kClassName; }
    std::string description() const override;
    bool isEqual(const Object& other) const override;

private:
    Number(Kind kind, uint64_t u, int64_t i, double d);
    Kind kind_;
    uint64_t u_;
    int64_t i_;
    double d_;
};

}  // namespace tamber
