#include "cli/ItemText.h"

#include <optional>
#include <ostream>
#include <string_view>

#include "cli/TextEscape.h"
#include "items/LocalItem.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"
#include "runtime/RecordedItem.h"

namespace tamber {

void printItemText(std::ostream& out, const HostPorterItem& item) {
    static const char* const kOrder[] = {
        "identifier",     "parentIdentifier", "filename",     "path",
        "typeIdentifier", "documentSize",     "creationDate", "contentModificationDate",
        "childItemCount", "capabilities",     "tags",         "favoriteRank",
        "lastUsedDate",   "trashed"};
    nlohmann::json json = HostJson::item(item);
    const auto* local = dynamic_cast<const LocalItem*>(&item);
    const auto* recorded = dynamic_cast<const RecordedItem*>(&item);
    std::optional<std::string> path;
    if (local)
        path = local->fileURL().path();
    else if (recorded)
        path = recorded->filePath();
    for (const char* key : kOrder) {
        const std::string_view name(key);
        const nlohmann::json& value = json.contains(key) ? json[key] : nlohmann::json();
        out << key << ": ";
        // The name and path as they are on disk, escaped: the JSON form has lost bad bytes.
        if (name == "filename")
            out << escapedText(item.filename());
        else if (name == "path" && path)
            out << escapedText(*path);
        else if (value.is_string())
            out << escapedText(value.get<std::string>());
        else if (value.is_null())
            out << "-";
        else if (name == "capabilities")
            out << "0x" << std::hex << value.get<uint64_t>() << std::dec;
        else
            out << jsonText(value);
        out << "\n";
    }
}

}  // namespace tamber
