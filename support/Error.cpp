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

// The user info entry `key`, or nothing.
std::string infoOr(const std::map<std::string, std::string>& info, const std::string& key) {
    auto it = info.find(key);
    return it == info.end() ? std::string() : it->second;
}

// Says what went wrong and, where the user info knows it, with what: these texts end up in
// front of a person (the command line prints them), so no bare "invalid parameter".
std::string reasonFor(const std::string& domain, int64_t code,
                      const std::map<std::string, std::string>& info) {
    auto with = [](std::string text, const std::string& subject) {
        return subject.empty() ? text : text + ": " + subject;
    };
    if (domain == kPosixErrorDomain)
        return with(std::strerror(static_cast<int>(code)), infoOr(info, "path"));
    if (domain == kHostPlatformErrorDomain) {
        if (code == kHostPlatformFileNoSuchFile)
            return with("no such file", infoOr(info, "path"));
        if (code == kHostPlatformFileWriteNoPermission)
            return with("no permission to write there", infoOr(info, "path"));
    }
    if (domain == kHostPorterErrorDomain) {
        if (code == kHostPorterSyncAnchorExpired)
            return "the sync anchor or page token expired; list again from the first page";
        if (code == kHostPorterNoSuchItem)
            return with("no such item", infoOr(info, "itemIdentifier"));
        if (code == kHostPorterInvalidParameter) {
            std::string parameter = infoOr(info, "parameter");
            std::string value = infoOr(info, "value");
            return with("invalid " + (parameter.empty() ? std::string("argument") : parameter),
                        value);
        }
    }
    return "the operation failed (" + domain + " code " + std::to_string(code) + ")";
}

}  // namespace

std::string Error::reason() const {
    auto it = userInfo_.find("description");
    return it != userInfo_.end() ? it->second : reasonFor(domain_, code_, userInfo_);
}

std::string Error::description() const {
    return "Error Domain=" + domain_ + " Code=" + std::to_string(code_) + " \"" + reason() + "\"";
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
                 {{"itemIdentifier", identifier}, {"description", "no such item: " + identifier}});
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
