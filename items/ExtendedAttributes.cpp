#include "items/ExtendedAttributes.h"

#include <cerrno>

#include "platform/FileSystem.h"
#include "support/Log.h"

namespace tamber {

namespace {

LogLevel levelUnless(int quietCode, const Error& error) {
    return error.code() == quietCode ? LogLevel::Debug : LogLevel::Error;
}

}  // namespace

std::optional<Bytes> ReadXattrData(const std::string& name, const Url& url) {
    FileSystem& fs = FileSystem::current();
    const std::string& path = url.path();
    ssize_t size = fs.lgetxattr(path, name, nullptr, 0);
    if (size < 0) {
        if (errno == ENODATA)
            return std::nullopt;
        Error error = Error::errorWithPOSIXCode(errno);
        logAt(levelUnless(ENOENT, error), "can't get xattr " + name + "; " + error.description());
        return std::nullopt;
    }
    // The buffer is exactly the size first reported; if the attribute shrank in between, the
    // tail stays zero rather than uninitialised.
    Bytes buffer(static_cast<size_t>(size));
    if (fs.lgetxattr(path, name, buffer.data(), buffer.size()) < 0) {
        Error error = Error::errorWithPOSIXCode(errno);
        logAt(levelUnless(ENOENT, error),
              "can't copy data for xattr " + name + "; " + error.description());
        return std::nullopt;
    }
    return buffer;
}

Status SetOrRemoveXattr(int fd, const std::optional<Bytes>& data, const std::string& name) {
    FileSystem& fs = FileSystem::current();
    if (!data) {
        if (fs.fremovexattr(fd, name) == 0 || errno == ENODATA) {
            return Status::OK();
        }
        Error error = Error::errorWithPOSIXCode(errno);
        logAt(levelUnless(EACCES, error),
              "can't remove xattr \"" + name + "\"; " + error.description());
        return error;
    }
    if (fs.fsetxattr(fd, name, data->data(), data->size(), 0) == 0) {
        return Status::OK();
    }
    Error error = Error::errorWithPOSIXCode(errno);
    logAt(levelUnless(EACCES, error), "can't set xattr \"" + name + "\"; " + error.description());
    return error;
}

}  // namespace tamber
