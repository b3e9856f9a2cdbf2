#pragma once

#include "platform/objects/Object.h"

namespace tamber {

// A point in time, as seconds since 1970-01-01T00:00:00Z (fractions kept).
class Date : public Object {
public:
    static constexpr std::string_view kClassName = "Date";
    explicit Date(double secondsSince1970) : seconds_(secondsSince1970) {}
    static std::shared_ptr<const Date> make(double secondsSince1970);
    static std::shared_ptr<const Date> now();

    double timeIntervalSince1970() const { return seconds_; }
    // ISO 8601 in UTC with milliseconds, e.g. "2026-11-23T05:10:12.000Z".
    std::string iso8601() const;

    std::string_view className() const override { return kClassName; }
    std::string description() const override { return iso8601(); }
    bool isEqual(const Object& other) const override;

private:
    double seconds_;
};

}  // namespace tamber
