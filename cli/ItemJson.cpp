#include "cli/ItemJson.h"

#include <ostream>
#include <string_view>

#include "cli/JsonValues.h"
#include "platform/Tag.h"

namespace tamber {

namespace {

nlohmann::json tagsJson(const LocalItem& item) {
    nlohmann::json labels = nlohmann::json::array();
    if (auto data = item.tagData()) {
        if (auto tags = GetTagsFromTagsData(*data))
            for (const auto& tag : *tags) labels.push_back(tag->label());
    }
    return labels;
}

}  // namespace

nlohmann::json itemJson(const LocalItem& item) {
    return {{"identifier", item.itemIdentifier()},
            {"parentIdentifier", item.parentItemIdentifier()},
            {"filename", item.filename()},
            {"typeIdentifier", item.typeIdentifier()},
            {"documentSize", numberJson(item.documentSize())},
            {"creationDate", dateJson(item.creationDate())},
            {"contentModificationDate", dateJson(item.contentModificationDate())},
            {"childItemCount", numberJson(item.childItemCount())},
            {"capabilities", item.capabilities()},
            {"tags", tagsJson(item)},
            {"favoriteRank", numberJson(item.favoriteRank())},
            {"lastUsedDate", dateJson(item.lastUsedDate())},
            {"trashed", item.isTrashed()},
            {"path", item.fileURL().path()}};
}

void printItemText(std::ostream& out, const LocalItem& item) {
    static const char* const kOrder[] = {
        "identifier",     "parentIdentifier", "filename",     "path",
        "typeIdentifier", "documentSize",     "creationDate", "contentModificationDate",
        "childItemCount", "capabilities",     "tags",         "favoriteRank",
        "lastUsedDate",   "trashed"};
    nlohmann::json json = itemJson(item);
    for (const char* key : kOrder) {
        const nlohmann::json& value = json[key];
        out << key << ": ";
        if (value.is_string())
            out << value.get<std::string>();
        else if (value.is_null())
            out << "-";
        else if (std::string_view(key) == "capabilities")
            out << "0x" << std::hex << value.get<uint64_t>() << std::dec;
        else
            out << value.dump();
        out << "\n";
    }
}

}  // namespace tamber
