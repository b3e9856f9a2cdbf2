#pragma once

#include <optional>
#include <string>

#include <httplib.h>
#include <nlohmann/json.hpp>

#include "host/HostPorterItem.h"
#include "host/HostPorterItemIdentifier.h"
#include "platform/objects/Data.h"
#include "support/Result.h"

namespace tamber {

// What the JSON routes share: reading parameters and bodies, and answering items.
class RouteSupport {
public:
    // The identifier a path segment names: the words root, working-set and all-directories
    // stand for the host's containers, anything else is an identifier as it is.
    static HostPorterItemIdentifier identifierFrom(const std::string& text);

    // A JSON object body of at most AccessControl::kMaxJsonBytes. Fills `response` with the
    // refusal (413 too large, 400 not a JSON object) and returns nothing when it is not one.
    static std::optional<nlohmann::json> readJsonObject(const httplib::Request& request,
                                                        httplib::Response& response,
                                                        const httplib::ContentReader& reader);
    static std::optional<nlohmann::json> parseJsonObject(const std::string& body,
                                                         httplib::Response& response);

    // A base64 query parameter (a page token, an anchor). A "+" that the query decoding turned
    // into a space is taken back.
    static std::optional<Bytes> base64Parameter(const std::string& text);

    // "2026-11-23T05:10:12Z" or with fractional seconds or a "+hh:mm" offset, as seconds since
    // the epoch.
    static std::optional<double> parseIso8601(const std::string& text);

    // Answers an operation's item as `tamber item --json` prints it, or its error.
    static void replyItem(httplib::Response& response, const Result<HostPorterItemRef>& item);
    // Answers 400 with `message`.
    static void replyBadRequest(httplib::Response& response, const std::string& message);
};

}  // namespace tamber
