#include "server/RouteSupport.h"

#include <cmath>
#include <cstdint>
#include <ctime>

#include "runtime/Base64.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"
#include "server/AccessControl.h"
#include "server/ApiReply.h"

namespace tamber {

HostPorterItemIdentifier RouteSupport::identifierFrom(const std::string& text) {
    if (text == "root")
        return HostPorterRootContainerItemIdentifier;
    if (text == "working-set")
        return HostPorterWorkingSetContainerItemIdentifier;
    if (text == "all-directories")
        return HostPorterAllDirectoriesContainerItemIdentifier;
    return text;
}

std::optional<nlohmann::json> RouteSupport::readJsonObject(const httplib::Request& request,
                                                           httplib::Response& response,
                                                           const httplib::ContentReader& reader) {
    std::string body;
    bool tooLarge = false;
    reader([&](const char* data, size_t length) {
        if (body.size() + length > AccessControl::kMaxJsonBytes) {
            tooLarge = true;
            return false;
        }
        body.append(data, length);
        return true;
    });
    (void)request;
    if (tooLarge) {
        ApiReply::json(response,
                       HostJson::error(Error("TamberServerErrorDomain", 413,
                                             {{"description", "request body too large"}})),
                       413);
        response.set_header("Connection", "close");
        return std::nullopt;
    }
    return parseJsonObject(body, response);
}

std::optional<nlohmann::json> RouteSupport::parseJsonObject(const std::string& body,
                                                            httplib::Response& response) {
    nlohmann::json value = nlohmann::json::parse(body, nullptr, false);
    if (value.is_discarded() || !value.is_object()) {
        replyBadRequest(response, "the request body is not a JSON object");
        return std::nullopt;
    }
    return value;
}

std::optional<Bytes> RouteSupport::base64Parameter(const std::string& text) {
    std::string repaired = text;
    for (char& c : repaired)
        if (c == ' ')
            c = '+';
    return base64Decode(repaired);
}

namespace {

// Reads exactly `count` digits at `at` into `value`.
bool digits(const std::string& text, size_t& at, size_t count, int& value) {
    if (at + count > text.size())
        return false;
    value = 0;
    for (size_t i = 0; i < count; ++i) {
        char c = text[at + i];
        if (c < '0' || c > '9')
            return false;
        value = value * 10 + (c - '0');
    }
    at += count;
    return true;
}

bool expect(const std::string& text, size_t& at, char c) {
    if (at >= text.size() || text[at] != c)
        return false;
    ++at;
    return true;
}

}  // namespace

std::optional<double> RouteSupport::parseIso8601(const std::string& text) {
    size_t at = 0;
    int year = 0, month = 0, day = 0, hour = 0, minute = 0, second = 0;
    if (!digits(text, at, 4, year) || !expect(text, at, '-') || !digits(text, at, 2, month) ||
        !expect(text, at, '-') || !digits(text, at, 2, day) || !expect(text, at, 'T') ||
        !digits(text, at, 2, hour) || !expect(text, at, ':') || !digits(text, at, 2, minute) ||
        !expect(text, at, ':') || !digits(text, at, 2, second))
        return std::nullopt;
    if (month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 || minute > 59 || second > 60)
        return std::nullopt;
    double fraction = 0;
    if (at < text.size() && text[at] == '.') {
        ++at;
        double scale = 0.1;
        size_t start = at;
        while (at < text.size() && text[at] >= '0' && text[at] <= '9') {
            fraction += (text[at] - '0') * scale;
            scale /= 10;
            ++at;
        }
        if (at == start)
            return std::nullopt;
    }
    int offset = 0;
    if (at < text.size() && text[at] == 'Z') {
        ++at;
    } else if (at < text.size() && (text[at] == '+' || text[at] == '-')) {
        int sign = text[at] == '-' ? -1 : 1;
        ++at;
        int hours = 0, minutes = 0;
        if (!digits(text, at, 2, hours) || !expect(text, at, ':') || !digits(text, at, 2, minutes))
            return std::nullopt;
        offset = sign * (hours * 3600 + minutes * 60);
    } else {
        return std::nullopt;
    }
    if (at != text.size())
        return std::nullopt;
    std::tm fields{};
    fields.tm_year = year - 1900;
    fields.tm_mon = month - 1;
    fields.tm_mday = day;
    fields.tm_hour = hour;
    fields.tm_min = minute;
    fields.tm_sec = second;
    time_t seconds = ::timegm(&fields);
    return static_cast<double>(seconds) - offset + fraction;
}

void RouteSupport::replyItem(httplib::Response& response, const Result<HostPorterItemRef>& item) {
    if (!item.ok())
        return ApiReply::error(response, item.error());
    if (!item.value())
        return ApiReply::error(response, Error::porterErrorForNonExistentItemWithIdentifier(""));
    ApiReply::json(response, HostJson::item(*item.value()));
}

void RouteSupport::replyBadRequest(httplib::Response& response, const std::string& message) {
    ApiReply::error(response, ApiReply::badRequest(message));
}

}  // namespace tamber
