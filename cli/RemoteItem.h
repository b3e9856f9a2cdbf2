#pragma once

#include <memory>
#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "host/HostPorterItem.h"
#include "runtime/RecordedItem.h"
#include "support/Result.h"

namespace tamber {

// An item as a server sent it (HostJson::item's record), rebuilt for the verbs: names and
// paths keep their exact bytes (from "filenameBytes" and "pathBytes" when the text had to be
// repaired), and it prints as the record it came from.
class RemoteItem : public HostPorterItem, public RecordedItem {
public:
    // Fails when `record` is not an item record (no identifier or name).
    static Result<HostPorterItemRef> fromJson(const nlohmann::json& record);

    HostPorterItemIdentifier itemIdentifier() const override;
    HostPorterItemIdentifier parentItemIdentifier() const override;
    std::string filename() const override { return filename_; }
    std::string typeIdentifier() const override;
    HostPorterItemCapabilities capabilities() const override;
    std::shared_ptr<const Number> documentSize() const override;
    std::shared_ptr<const Number> childItemCount() const override;
    std::shared_ptr<const Date> creationDate() const override;
    std::shared_ptr<const Date> contentModificationDate() const override;
    std::shared_ptr<const Date> lastUsedDate() const override;
    std::optional<Bytes> tagData() const override;
    std::shared_ptr<const Number> favoriteRank() const override;
    bool isTrashed() const override;
    std::string description() const override;

    const nlohmann::json& record() const override { return record_; }
    std::optional<std::string> filePath() const override { return path_; }

    // An ISO 8601 UTC time as HostJson writes it ("2024-05-01T10:00:00Z", with or without a
    // fraction); nothing for anything else.
    static std::optional<double> parseDate(const std::string& text);

private:
    RemoteItem() = default;

    std::shared_ptr<const Number> number(const char* key) const;
    std::shared_ptr<const Date> date(const char* key) const;

    nlohmann::json record_;
    std::string filename_;
    std::optional<std::string> path_;
};

}  // namespace tamber
