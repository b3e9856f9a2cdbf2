#pragma once

#include <nlohmann/json.hpp>

#include "items/LocalItem.h"

namespace tamber {

// An item record as every verb prints it with --json.
nlohmann::json itemJson(const LocalItem& item);
// The same record as "key: value" lines for people.
void printItemText(std::ostream& out, const LocalItem& item);

}  // namespace tamber
