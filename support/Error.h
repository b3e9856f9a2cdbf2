#pragma once

#include <cstdint>
#include <map>
#include <string>

namespace tamber {

// Error domains used across the program.
inline constexpr const char* kPosixErrorDomain = "PosixErrorDomain";
inline constexpr const char* kHostPlatformErrorDomain = "HostPlatformErrorDomain";
inline constexpr const char* kHostPorterErrorDomain = "HostPorterErrorDomain";
inline constexpr const char* kUnarchiveErrorDomain = "UnarchiveError";
inline constexpr const char* kArchiveErrorDomain = "KeyedArchiveErrorDomain";

// Codes of the host platform domain.
inline constexpr int64_t kHostPlatformFileNoSuchFile = 260;
inline constexpr int64_t kHostPlatformFileWriteNoPermission = 513;

// Codes of the host framework domain.
inline constexpr int64_t kHostPorterNoSuchItem = -1005;
inline constexpr int64_t kHostPorterSyncAnchorExpired = -1002;
inline constexpr int64_t kHostPorterInvalidParameter = -1009;

// An error value: a domain, a code and optional user info. Copyable and cheap.
class Error {
public:
    Error() = default;
    Error(std::string domain, int64_t code, std::map<std::string, std::string> userInfo = {});

    const std::string& domain() const { return domain_; }
    int64_t code() const { return code_; }
    const std::map<std::string, std::string>& userInfo() const { return userInfo_; }

    bool is(std::string_view domain, int64_t code) const;

    // What went wrong, for a person: the user info's "description" entry, or strerror for the
    // POSIX domain, or a text per known code that names the item, path or parameter the user
    // info holds.
    std::string reason() const;
    // Human-readable: `Error Domain=D Code=C "reason"`.
    std::string description() const;

    // Builds a POSIX error from the *current* errno. The argument is ignored on purpose: every
    // caller calls this right after the failing system call, and errno is the truth.
    static Error errorWithPOSIXCode(int ignored);
    // A POSIX error for an explicit errno value (for code that saved errno earlier).
    static Error posix(int code);
    static Error errorFileWriteNoPermission();
    static Error fileNoSuchFile(const std::string& path = {});
    // The host framework's errors.
    static Error porterErrorForNonExistentItemWithIdentifier(const std::string& identifier);
    static Error invalidParameter(const std::string& parameter, const std::string& value = {});
    static Error syncAnchorExpired();

    friend bool operator==(const Error& a, const Error& b) {
        return a.domain_ == b.domain_ && a.code_ == b.code_;
    }

private:
    std::string domain_;
    int64_t code_ = 0;
    std::map<std::string, std::string> userInfo_;
};

}  // namespace tamber
