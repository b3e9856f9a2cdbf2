#pragma once

#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "cli/Command.h"
#include "items/ItemMetadata.h"
#include "provider/LocalPorter.h"

namespace tamber {

// `tamber meta PATH`: shows, and with --set-* options changes, an item's user metadata.
class MetaCommand : public Command {
public:
    CLI::App* add(CLI::App& app) override;
    int run(CliContext& context) override;

    // The JSON form of decoded metadata (keys lastUsedDate, tags, favoriteRank, trashDate,
    // putBack; null where absent).
    static nlohmann::json toJson(const ItemMetadata& metadata);

private:
    // The changes the --set-* options ask for, or a usage error for a bad value.
    Result<LocalPorter::MetadataChanges> parseChanges() const;

    std::string path_;
    bool json_ = false;
    std::optional<std::string> setTags_;
    std::optional<std::string> setRank_;
    std::optional<std::string> setLastUsed_;
};

}  // namespace tamber
