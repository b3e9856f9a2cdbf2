#pragma once

#include <memory>

#include <nlohmann/json.hpp>

#include "platform/objects/Date.h"
#include "platform/objects/Number.h"

namespace tamber {

// How values appear in the command line's JSON: dates as ISO 8601 UTC text, numbers as their
// own kind, absent values as null. A date without a calendar date to write (NaN, infinite,
// outside the years 0000 to 9999) is null too, never text that a parser would choke on.
nlohmann::json dateJson(const std::shared_ptr<const Date>& date);
nlohmann::json numberJson(const std::shared_ptr<const Number>& number);

}  // namespace tamber
