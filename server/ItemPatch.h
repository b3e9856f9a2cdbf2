#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "host/HostPorterExtension.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "support/Result.h"

namespace tamber {

// The changes `PATCH items/{id}` asks for, checked whole before any is made: a request with
// one bad field changes nothing.
//
// Fields: "filename" (rename; with "parentIdentifier" the move gives the name),
// "parentIdentifier" (move there; with "trashed": false put back there), "tags" (array of
// labels: replaces the tags; empty clears), "favoriteRank" (integer or null), "lastUsedDate"
// (ISO 8601 text, "now", or null), "trashed" (true trashes, false puts back).
class ItemPatch {
public:
    static Result<ItemPatch> parse(const nlohmann::json& body);

    // Makes the changes in the order: trash or put back or move, rename, tags, rank, last-used
    // date. Answers the item as the last change left it, or the first failure.
    Result<HostPorterItemRef> apply(HostPorterExtension& provider,
                                    const HostPorterItemIdentifier& identifier) const;

private:
    std::optional<std::string> filename_;
    std::optional<HostPorterItemIdentifier> parent_;
    std::optional<std::vector<std::string>> tags_;
    bool setRank_ = false;
    std::shared_ptr<const Number> rank_;  // null clears
    bool setLastUsed_ = false;
    std::shared_ptr<const Date> lastUsed_;  // null clears
    std::optional<bool> trashed_;
};

}  // namespace tamber
