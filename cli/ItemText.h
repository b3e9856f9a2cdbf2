#pragma once

#include <iosfwd>

#include "host/HostPorterItem.h"

namespace tamber {

// An item record as "key: value" lines for people, in the order of its JSON form.
void printItemText(std::ostream& out, const HostPorterItem& item);

}  // namespace tamber
