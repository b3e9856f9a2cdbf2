#pragma once

#include <memory>

#include <nlohmann/json.hpp>

#include "platform/objects/Date.h"
#include "platform/objects/Number.h"

namespace tamber {

// How values appear in the command line's JSON: dates as ISO 8601 UTC text, numbers as their
// own kind, absent values as null.
nlohmann::json dateJson(const std::shared_ptr<const Date>& date);
nlohmann::json numberJson(const std::shared_ptr<const Number>& number);

}  // namespace tamber
