#include "items/ExtendedAttributes.h"

#include <cerrno>
#include <memory>

#include "host/UrlOperations.h"
#include "platform/FileSystem.h"
#include "platform/strata/StrataService.h"
#include "support/Log.h"

namespace tamber {

namespace {

LogLevel levelUnless(int quietCode, const Error& error) {
    return error.code() == quietCode ? LogLevel::Debug : LogLevel::Error;
}

// The document's copy of its metadata follows what Tamber writes at once, so that a save right
// after does not lose it while the attribute event waits in the journal.
void noteWritten(int fd, const std::optional<Bytes>& data, const std::string& name) {
    if (auto strata = StrataService::current())
        strata->metadataAttributeWritten(fd, name, data);
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
            noteWritten(fd, data, name);
            return Status::OK();
        }
        Error error = Error::errorWithPOSIXCode(errno);
        logAt(levelUnless(EACCES, error),
              "can't remove xattr \"" + name + "\"; " + error.description());
        return error;
    }
    if (fs.fsetxattr(fd, name, data->data(), data->size(), 0) == 0) {
        noteWritten(fd, data, name);
        return Status::OK();
    }
    Error error = Error::errorWithPOSIXCode(errno);
    logAt(levelUnless(EACCES, error), "can't set xattr \"" + name + "\"; " + error.description());
    return error;
}

Status WriteXattrAtURL(const Url& url, const std::optional<Bytes>& data, const std::string& name) {
    bool ok =
        pt_withReadWriteAccess(url, [&](int fd) { return SetOrRemoveXattr(fd, data, name).ok(); });
    if (ok)
        return Status::OK();
    Error error = Error::errorWithPOSIXCode(errno);
    logError("can't set xattr " + name + " on " + url.absoluteString() + "; " +
             error.description());
    return error;
}

}  // namespace tamber
