#include "support/Error.h"

#include <cerrno>
#include <cstring>

namespace tamber {

Error::Error(std::string domain, int64_t code, std::map<std::string, std::string> userInfo)
    : domain_(std::move(domain)), code_(code), userInfo_(std::move(userInfo)) {}

bool Error::is(std::string_view domain, int64_t code) const {
    return domain_ == domain && code_ == code;
}

namespace {

std::string reasonFor(const std::string& domain, int64_t code) {
    if (domain == kPosixErrorDomain) {
        return std::strerror(static_cast<int>(code));
    }
    if (domain == kHostPlatformErrorDomain) {
        if (code == kHostPlatformFileNoSuchFile)
            return "The file doesn't exist.";
        if (code == kHostPlatformFileWriteNoPermission)
            return "You don't have permission to save the file.";
    }
    if (domain == kHostPorterErrorDomain) {
        if (code == kHostPorterSyncAnchorExpired)
            return "The sync anchor expired.";
        if (code == kHostPorterNoSuchItem)
            return "The item doesn't exist.";
        if (code == kHostPorterInvalidParameter)
            return "A parameter is invalid.";
    }
    return "The operation couldn't be completed.";
}

}  // namespace

std::string Error::description() const {
    auto it = userInfo_.find("description");
    std::string reason = it != userInfo_.end() ? it->second : reasonFor(domain_, code_);
    return "Error Domain=" + domain_ + " Code=" + std::to_string(code_) + " \"" + reason + "\"";
}

Error Error::errorWithPOSIXCode(int /*ignored*/) {
    return Error(kPosixErrorDomain, errno);
}

Error Error::posix(int code) {
    return Error(kPosixErrorDomain, code);
}

Error Error::errorFileWriteNoPermission() {
    return Error(kHostPlatformErrorDomain, kHostPlatformFileWriteNoPermission);
}

Error Error::fileNoSuchFile(const std::string& path) {
    std::map<std::string, std::string> info;
    if (!path.empty())
        info["path"] = path;
    return Error(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile, std::move(info));
}

Error Error::porterErrorForNonExistentItemWithIdentifier(const std::string& identifier) {
    return Error(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                 {{"itemIdentifier", identifier},
                  {"description", "no item with identifier \"" + identifier + "\""}});
}

Error Error::invalidParameter(const std::string& parameter, const std::string& value) {
    std::map<std::string, std::string> info{{"parameter", parameter}};
    if (!value.empty())
        info["value"] = value;
    return Error(kHostPorterErrorDomain, kHostPorterInvalidParameter, std::move(info));
}

Error Error::syncAnchorExpired() {
    return Error(kHostPorterErrorDomain, kHostPorterSyncAnchorExpired);
}

}  // namespace tamber
