#pragma once

#include <string>

#include <httplib.h>
#include <nlohmann/json.hpp>

#include "support/Error.h"

namespace tamber {

// How every route answers: JSON bodies in the shapes the command line prints with --json, and
// errors as the command line's error object with the HTTP status that fits.
class ApiReply {
public:
    static void json(httplib::Response& response, const nlohmann::json& body, int status = 200);
    // The error object ({"error": {"domain", "code", "message"}}) with httpStatusFor(error).
    static void error(httplib::Response& response, const Error& error);
    // 400 bad parameter or name, 404 no such item (also a path or identifier outside the
    // published trees), 409 name taken or anchor expired (-1002), 403 write refused, 500
    // anything else.
    static int httpStatusFor(const Error& error);
    // An error of this program's own (bad request parameter, refused request) with a message.
    static Error badRequest(const std::string& message);
};

}  // namespace tamber
