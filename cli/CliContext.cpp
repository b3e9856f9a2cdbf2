#include "cli/CliContext.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ostream>

#include "applibraries/SharedAppLibraryLookup.h"
#include "applibraries/TBPAppLibraryManager.h"
#include "host/HostPorterManager.h"
#include "host/StagingCopies.h"
#include "platform/FileContents.h"
#include "platform/tremors/TremorService.h"
#include "support/Log.h"

namespace tamber {

CliContext::CliContext(std::ostream& out, std::ostream& err) : out_(out), err_(err) {}

namespace {

std::string defaultStoragePath() {
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "/") + "/Documents";
}

}  // namespace

Status CliContext::prepareStorage() {
    std::string path = storagePath.empty() ? defaultStoragePath() : storagePath;
    storage_ = Url::fileURLWithPath(path);
    if (auto failure = FileContents::createDirectory(storage_)) {
        const Error& error = *failure;
        logError("can't create document storage folder " + storage_.path() + "; " +
                 error.description());
        return Error(error.domain(), error.code(),
                     {{"description", "can't use document storage folder " + storage_.path() +
                                          ": " + std::strerror(static_cast<int>(error.code()))}});
    }
    std::weak_ptr<SignalSlot> weakSlot = signals_;
    HostPorterManager::installDefaultManager(std::make_shared<StorageHostPorterManager>(
        storage_, [weakSlot](const HostPorterItemIdentifier& container) {
            auto slot = weakSlot.lock();
            if (!slot)
                return;
            std::lock_guard lock(slot->mutex);
            if (slot->handler)
                slot->handler(container);
        }));
    return std::nullopt;
}

Status CliContext::prepareJournal() {
    auto service = TremorService::shared();
    if (!service.ok())
        return service.error();
    return service.value()->watchTree(storage_.path());
}

Result<std::shared_ptr<LocalPorter>> CliContext::prepareProvider() {
    if (porter_)
        return porter_;
    if (auto error = prepareJournal())
        return *error;
    SharedAppLibraryLookup::install();
    auto porter = LocalPorter::create();
    refreshOutcome_ = porter->refreshAppLibraries();
    // Identifiers inside app libraries need their trees journaled like the storage folder.
    auto service = TremorService::shared();
    for (const Url& root : TBPAppLibraryManager::rootURLsForAppLibraries()) {
        if (auto error = service.value()->watchTree(root.path()))
            logError("can't watch app library " + root.path() + "; " + error->description());
    }
    StagingCopies::sweepStale();  // copies left by imports that were killed part-way
    porter_ = porter;
    return porter_;
}

void CliContext::setSignalHandler(SignalHandler handler) {
    std::lock_guard lock(signals_->mutex);
    signals_->handler = std::move(handler);
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
