#include "server/ApiReply.h"

#include <cerrno>

#include "provider/LocalPorterError.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"

namespace tamber {

void ApiReply::json(httplib::Response& response, const nlohmann::json& body, int status) {
    response.status = status;
    response.set_content(jsonText(body), "application/json");
}

void ApiReply::error(httplib::Response& response, const Error& error) {
    json(response, HostJson::error(error), httpStatusFor(error));
}

int ApiReply::httpStatusFor(const Error& error) {
    const auto& domain = error.domain();
    const int64_t code = error.code();
    if (domain == kHostPorterErrorDomain) {
        if (code == kHostPorterInvalidParameter)
            return 400;
        if (code == kHostPorterNoSuchItem)
            return 404;
        if (code == kHostPorterSyncAnchorExpired)
            return 409;
        return 500;
    }
    if (domain == kLocalPorterErrorDomain)
        return code == static_cast<int64_t>(LocalPorterError::invalidItemURL) ? 400 : 404;
    if (domain == kHostPlatformErrorDomain) {
        if (code == kHostPlatformFileNoSuchFile)
            return 404;
        if (code == kHostPlatformFileWriteNoPermission)
            return 403;
        return 500;
    }
    if (domain == kPosixErrorDomain) {
        switch (code) {
            case ENOENT:
                return 404;
            case EEXIST:
            case ENOTEMPTY:
                return 409;
            case EACCES:
            case EPERM:
            case EROFS:
                return 403;
            case EINVAL:
            case ENAMETOOLONG:
            case ENOTDIR:
            case EISDIR:
                return 400;
            default:
                return 500;
        }
    }
    return 500;
}

Error ApiReply::badRequest(const std::string& message) {
    return Error(kHostPorterErrorDomain, kHostPorterInvalidParameter, {{"description", message}});
}

}  // namespace tamber
