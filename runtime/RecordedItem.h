#pragma once

#include <optional>
#include <string>

#include <nlohmann/json.hpp>

namespace tamber {

// An item rebuilt from the record another host sent (a server's answer to the command line).
// It is shown exactly as that record: HostJson gives the record back unchanged, so a verb
// prints the same bytes whether it ran here or there.
class RecordedItem {
public:
    virtual ~RecordedItem() = default;
    // The record as HostJson::item wrote it.
    virtual const nlohmann::json& record() const = 0;
    // The exact bytes of the item's path, when the record has one.
    virtual std::optional<std::string> filePath() const = 0;
};

}  // namespace tamber
