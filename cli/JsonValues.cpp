#include "cli/JsonValues.h"

#include <cmath>
#include <string>

namespace tamber {

namespace {

// 0000-01-01T00:00:00Z and 9999-12-31T23:59:59Z: the dates ISO 8601's four-digit years can
// write. An attribute can hold any double (NaN, 1e300); such a date has no text to show.
constexpr double kFirstWritable = -62167219200.0;
constexpr double kLastWritable = 253402300799.0;

}  // namespace

nlohmann::json dateJson(const std::shared_ptr<const Date>& date) {
    if (!date)
        return nullptr;
    double seconds = date->timeIntervalSince1970();
    if (!std::isfinite(seconds) || seconds < kFirstWritable || seconds > kLastWritable)
        return nullptr;
    std::string text = date->iso8601();
    // The formatter has narrower limits of its own on some systems; what it can't write is
    // not a date either.
    if (text.empty() || text.front() < '0' || text.front() > '9')
        return nullptr;
    return text;
}

nlohmann::json numberJson(const std::shared_ptr<const Number>& n) {
    if (!n)
        return nullptr;
    switch (n->kind()) {
        case Number::Kind::Unsigned:
            return n->uint64Value();
        case Number::Kind::Signed:
            return n->int64Value();
        case Number::Kind::Floating:
            return n->doubleValue();
        case Number::Kind::Boolean:
            return n->boolValue();
    }
    return nullptr;
}

}  // namespace tamber
