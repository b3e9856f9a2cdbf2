#pragma once

#include <string>
#include <vector>

namespace tamber {

// The tag labels a verb was given, as they are stored: an empty label is no tag, and a label
// given twice is one tag, kept where it first appeared.
class TagLabels {
public:
    static std::vector<std::string> cleaned(const std::vector<std::string>& labels);
};

}  // namespace tamber
