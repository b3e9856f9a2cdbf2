#include "cli/RemoteItem.h"

#include <cerrno>
#include <cstdio>
#include <ctime>
#include <vector>

#include "items/ItemMetadata.h"
#include "runtime/Base64.h"

namespace tamber {

namespace {

std::string text(const nlohmann::json& record, const char* key) {
    auto found = record.find(key);
    return found != record.end() && found->is_string() ? found->get<std::string>() : std::string();
}

// The exact bytes of a name or path: the base64 beside the text when the text was repaired.
std::optional<std::string> exactText(const nlohmann::json& record, const char* key,
                                     const char* bytesKey) {
    if (auto bytes = record.find(bytesKey); bytes != record.end() && bytes->is_string()) {
        if (auto decoded = base64Decode(bytes->get<std::string>()))
            return std::string(decoded->begin(), decoded->end());
    }
    if (auto found = record.find(key); found != record.end() && found->is_string())
        return found->get<std::string>();
    return std::nullopt;
}

}  // namespace

Result<HostPorterItemRef> RemoteItem::fromJson(const nlohmann::json& record) {
    auto name = record.is_object() ? exactText(record, "filename", "filenameBytes") : std::nullopt;
    if (!name || text(record, "identifier").empty())
        return Error(kPosixErrorDomain, EPROTO,
                     {{"description",
                       "the Tamber server sent an item without an identifier "
                       "or a name"}});
    std::shared_ptr<RemoteItem> item(new RemoteItem());
    item->record_ = record;
    item->filename_ = std::move(*name);
    item->path_ = exactText(record, "path", "pathBytes");
    return HostPorterItemRef(item);
}

HostPorterItemIdentifier RemoteItem::itemIdentifier() const {
    return text(record_, "identifier");
}

HostPorterItemIdentifier RemoteItem::parentItemIdentifier() const {
    return text(record_, "parentIdentifier");
}

std::string RemoteItem::typeIdentifier() const {
    return text(record_, "typeIdentifier");
}

HostPorterItemCapabilities RemoteItem::capabilities() const {
    auto found = record_.find("capabilities");
    return found != record_.end() && found->is_number_unsigned()
               ? found->get<HostPorterItemCapabilities>()
               : 0;
}

std::shared_ptr<const Number> RemoteItem::number(const char* key) const {
    auto found = record_.find(key);
    if (found == record_.end())
        return nullptr;
    if (found->is_number_unsigned())
        return Number::fromUInt64(found->get<uint64_t>());
    if (found->is_number_integer())
        return Number::fromInt64(found->get<int64_t>());
    if (found->is_number_float())
        return Number::fromDouble(found->get<double>());
    if (found->is_boolean())
        return Number::fromBool(found->get<bool>());
    return nullptr;
}

std::shared_ptr<const Date> RemoteItem::date(const char* key) const {
    auto seconds = parseDate(text(record_, key));
    return seconds ? Date::make(*seconds) : nullptr;
}

std::shared_ptr<const Number> RemoteItem::documentSize() const {
    return number("documentSize");
}

std::shared_ptr<const Number> RemoteItem::childItemCount() const {
    return number("childItemCount");
}

std::shared_ptr<const Date> RemoteItem::creationDate() const {
    return date("creationDate");
}

std::shared_ptr<const Date> RemoteItem::contentModificationDate() const {
    return date("contentModificationDate");
}

std::shared_ptr<const Date> RemoteItem::lastUsedDate() const {
    return date("lastUsedDate");
}

std::optional<Bytes> RemoteItem::tagData() const {
    auto tags = record_.find("tags");
    if (tags == record_.end() || !tags->is_array() || tags->empty())
        return std::nullopt;
    std::vector<std::string> labels;
    for (const auto& label : *tags)
        if (label.is_string())
            labels.push_back(label.get<std::string>());
    return ItemMetadata::tagDataForLabels(labels);
}

std::shared_ptr<const Number> RemoteItem::favoriteRank() const {
    return number("favoriteRank");
}

bool RemoteItem::isTrashed() const {
    return record_.value("trashed", false);
}

std::string RemoteItem::description() const {
    return "<RemoteItem " + itemIdentifier() + " " + filename_ + ">";
}

std::optional<double> RemoteItem::parseDate(const std::string& text) {
    std::tm tm{};
    int millis = 0;
    int consumed = 0;
    if (std::sscanf(text.c_str(), "%4d-%2d-%2dT%2d:%2d:%2d%n", &tm.tm_year, &tm.tm_mon, &tm.tm_mday,
                    &tm.tm_hour, &tm.tm_min, &tm.tm_sec, &consumed) != 6)
        return std::nullopt;
    std::string rest = text.substr(static_cast<size_t>(consumed));
    if (rest.size() == 5 && rest[0] == '.' && rest[4] == 'Z') {
        for (size_t i = 1; i < 4; ++i) {
            if (rest[i] < '0' || rest[i] > '9')
                return std::nullopt;
            millis = millis * 10 + (rest[i] - '0');
        }
    } else if (rest != "Z") {
        return std::nullopt;
    }
    tm.tm_year -= 1900;
    tm.tm_mon -= 1;
    return static_cast<double>(timegm(&tm)) + millis / 1000.0;
}

}  // namespace tamber
