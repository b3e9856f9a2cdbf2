#include "cli/ItemJson.h"

#include <ostream>
#include <string_view>

#include "cli/JsonValues.h"
#include "cli/TextEscape.h"
#include "platform/Tag.h"

namespace tamber {

namespace {

nlohmann::json tagsJson(const LocalItem& item) {
    nlohmann::json labels = nlohmann::json::array();
    if (auto data = item.tagData()) {
        if (auto tags = GetTagsFromTagsData(*data))
            for (const auto& tag : *tags) labels.push_back(validUtf8(tag->label()));
    }
    return labels;
}

}  // namespace

nlohmann::json itemJson(const LocalItem& item) {
    nlohmann::json json{{"identifier", validUtf8(item.itemIdentifier())},
                        {"parentIdentifier", validUtf8(item.parentItemIdentifier())},
                        {"typeIdentifier", item.typeIdentifier()},
                        {"documentSize", numberJson(item.documentSize())},
                        {"creationDate", dateJson(item.creationDate())},
                        {"contentModificationDate", dateJson(item.contentModificationDate())},
                        {"childItemCount", numberJson(item.childItemCount())},
                        {"capabilities", item.capabilities()},
                        {"tags", tagsJson(item)},
                        {"favoriteRank", numberJson(item.favoriteRank())},
                        {"lastUsedDate", dateJson(item.lastUsedDate())},
                        {"trashed", item.isTrashed()}};
    // Names are bytes: one that is not UTF-8 is shown with U+FFFD and given exactly beside it.
    setTextWithBytes(json, "filename", "filenameBytes", item.filename());
    setTextWithBytes(json, "path", "pathBytes", item.fileURL().path());
    return json;
}

void printItemText(std::ostream& out, const LocalItem& item) {
    static const char* const kOrder[] = {
        "identifier",     "parentIdentifier", "filename",     "path",
        "typeIdentifier", "documentSize",     "creationDate", "contentModificationDate",
        "childItemCount", "capabilities",     "tags",         "favoriteRank",
        "lastUsedDate",   "trashed"};
    nlohmann::json json = itemJson(item);
    for (const char* key : kOrder) {
        const std::string_view name(key);
        const nlohmann::json& value = json[key];
        out << key << ": ";
        // The name and path as they are on disk, escaped: the JSON form has lost bad bytes.
        if (name == "filename")
            out << escapedText(item.filename());
        else if (name == "path")
            out << escapedText(item.fileURL().path());
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
