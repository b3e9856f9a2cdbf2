#include "cli/CliContext.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ostream>

#include "host/HostPorterManager.h"
#include "platform/FileSystem.h"
#include "platform/tremors/TremorService.h"
#include "support/Log.h"

namespace tamber {

CliContext::CliContext(std::ostream& out, std::ostream& err) : out_(out), err_(err) {}

namespace {

std::string defaultStoragePath() {
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "/") + "/Documents";
}

// mkdir -p through the platform layer.
bool makeDirectories(const std::string& path) {
    FileSystem& fs = FileSystem::current();
    for (size_t pos = 1; pos <= path.size(); ++pos) {
        if (pos != path.size() && path[pos] != '/')
            continue;
        std::string prefix = path.substr(0, pos);
        if (fs.mkdir(prefix, 0755) != 0 && errno != EEXIST)
            return false;
    }
    struct statx st {};
    if (fs.statx(AT_FDCWD, path, 0, STATX_TYPE, &st) != 0)
        return false;
    if (!S_ISDIR(st.stx_mode)) {
        errno = ENOTDIR;
        return false;
    }
    return true;
}

}  // namespace

Status CliContext::prepareStorage() {
    std::string path = storagePath.empty() ? defaultStoragePath() : storagePath;
    storage_ = Url::fileURLWithPath(path);
    if (!makeDirectories(storage_.path())) {
        Error error = Error::errorWithPOSIXCode(errno);
        logError("can't create document storage folder " + storage_.path() + "; " +
                 error.description());
        return Error(error.domain(), error.code(),
                     {{"description", "can't use document storage folder " + storage_.path() +
                                          ": " + std::strerror(static_cast<int>(error.code()))}});
    }
    HostPorterManager::installDefaultManager(std::make_shared<StorageHostPorterManager>(storage_));
    return std::nullopt;
}

Status CliContext::prepareJournal() {
    auto service = TremorService::shared();
    if (!service.ok())
        return service.error();
    return service.value()->watchTree(storage_.path());
}

Error CliContext::usageError(const std::string& message) {
    return Error(kHostPorterErrorDomain, kHostPorterInvalidParameter, {{"description", message}});
}

std::string CliContext::errorMessage(const Error& error) {
    auto it = error.userInfo().find("description");
    if (it != error.userInfo().end())
        return it->second;
    if (error.domain() == kPosixErrorDomain)
        return std::strerror(static_cast<int>(error.code()));
    std::string text = error.description();
    auto quote = text.find('"');
    return quote == std::string::npos ? text : text.substr(quote + 1, text.size() - quote - 2);
}

nlohmann::json CliContext::errorJson(const Error& error) {
    return {
        {"error",
         {{"domain", error.domain()}, {"code", error.code()}, {"message", errorMessage(error)}}}};
}

int CliContext::fail(const Error& error, bool json) {
    if (json) {
        out_ << errorJson(error).dump() << "\n";
    } else {
        err_ << "tamber: " << errorMessage(error) << " (" << error.domain() << " " << error.code()
             << ")\n";
    }
    return 1;
}

}  // namespace tamber
