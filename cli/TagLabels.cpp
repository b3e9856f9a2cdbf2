#include "cli/TagLabels.h"

#include <set>

namespace tamber {

std::vector<std::string> TagLabels::cleaned(const std::vector<std::string>& labels) {
    std::vector<std::string> kept;
    std::set<std::string> seen;
    for (const auto& label : labels) {
        if (!label.empty() && seen.insert(label).second)
            kept.push_back(label);
    }
    return kept;
}

}  // namespace tamber
