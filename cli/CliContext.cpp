#include "cli/CliContext.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ostream>
#include <utility>

#include "applibraries/SharedAppLibraryLookup.h"
#include "applibraries/TBPAppLibraryManager.h"
#include "cli/JsonValues.h"
#include "host/HostPorterManager.h"
#include "host/PublishedTrees.h"
#include "host/StagingCopies.h"
#include "platform/FileContents.h"
#include "platform/tremors/TremorService.h"
#include "provider/LocalPorterError.h"
#include "support/Log.h"

namespace tamber {

CliContext::CliContext(std::ostream& out, std::ostream& err) : out_(out), err_(err) {
    waitNotice_->err = &err_;
}

CliContext::~CliContext() {
    {
        std::lock_guard lock(waitNotice_->mutex);
        waitNotice_->err = nullptr;
    }
    if (publishing_)
        publishing_->retireUnwatched();
}

namespace {

std::string defaultStoragePath() {
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "/") + "/Documents";
}

}  // namespace

Status CliContext::prepareStorage() {
    std::string path = storagePath.empty() ? defaultStoragePath() : storagePath;
    storage_ = Url::fileURLWithPath(path);
    if (auto failure = FileContents::createDirectory(storage_); !failure.ok()) {
        const Error& error = failure.error();
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
    return Status::OK();
}

Result<std::shared_ptr<TremorService>> CliContext::startJournal() {
    std::weak_ptr<WaitNotice> weakNotice = waitNotice_;
    TremorService::setLockWait(
        {waitSeconds, [weakNotice](pid_t holder, const std::string& directory) {
             auto notice = weakNotice.lock();
             if (!notice)
                 return;
             std::lock_guard lock(notice->mutex);
             // Once a run: each volume's journal may make it wait.
             if (!notice->err || std::exchange(notice->told, true))
                 return;
             *notice->err << "tamber: waiting for "
                          << (holder ? "Tamber process " + std::to_string(holder)
                                     : std::string("another Tamber process"))
                          << " to release the state directory " << directory << "\n";
             notice->err->flush();
         }});
    return TremorService::shared();
}

Status CliContext::prepareJournal() {
    auto service = startJournal();
    if (!service.ok())
        return service.error();
    return service.value()->watchTree(storage_.path());
}

Result<std::shared_ptr<LocalPorter>> CliContext::prepareProvider() {
    if (porter_)
        return porter_;
    if (auto status = prepareJournal(); !status.ok())
        return status.error();
    SharedAppLibraryLookup::install();
    auto porter = LocalPorter::create();
    refreshOutcome_ = porter->refreshAppLibraries();
    // Identifiers inside app libraries need their trees journaled like the storage folder.
    auto service = TremorService::shared();
    for (const Url& root : TBPAppLibraryManager::rootURLsForAppLibraries()) {
        if (auto status = service.value()->watchTree(root.path()); !status.ok())
            logError("can't watch app library " + root.path() + "; " +
                     status.error().description());
    }
    StagingCopies::sweepStale();  // copies left by imports that were killed part-way
    porter_ = porter;
    publishing_ = service.value();
    return porter_;
}

void CliContext::setSignalHandler(SignalHandler handler) {
    std::lock_guard lock(signals_->mutex);
    signals_->handler = std::move(handler);
}

void CliContext::setInvocation(std::string verb, std::vector<std::string> arguments) {
    verb_ = std::move(verb);
    arguments_ = std::move(arguments);
}

namespace {

// Marks the errors made from bad command-line input; their domain and code stay the host
// framework's invalid-parameter error, as scripts have seen them.
constexpr const char* kUsageKey = "usage";
constexpr const char* kInternalErrorDomain = "tamber.InternalError";

}  // namespace

Error CliContext::usageError(const std::string& message) {
    return Error(kHostPorterErrorDomain, kHostPorterInvalidParameter,
                 {{"description", message}, {kUsageKey, "1"}});
}

bool CliContext::isUsageError(const Error& error) {
    return error.userInfo().contains(kUsageKey);
}

Error CliContext::internalError(const std::string& what) {
    return Error(kInternalErrorDomain, 1, {{"description", "internal error: " + what}});
}

int CliContext::exitStatusFor(const Error& error) {
    if (isUsageError(error))
        return kExitUsage;
    // Something outside the published trees exists; it is refused, not missing.
    if (PublishedTrees::isOutsideError(error))
        return kExitFailure;
    const bool notFound =
        error.is(kHostPorterErrorDomain, kHostPorterNoSuchItem) ||
        error.is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile) ||
        error.is(kPosixErrorDomain, ENOENT) ||
        error.is(kLocalPorterErrorDomain, static_cast<int64_t>(LocalPorterError::itemNotFound)) ||
        error.is(kLocalPorterErrorDomain,
                 static_cast<int64_t>(LocalPorterError::invalidItemIdentifier));
    return notFound ? kExitNotFound : kExitFailure;
}

std::string CliContext::errorMessage(const Error& error) {
    return error.reason();
}

nlohmann::json CliContext::errorJson(const Error& error) {
    return {
        {"error",
         {{"domain", error.domain()}, {"code", error.code()}, {"message", errorMessage(error)}}}};
}

std::string CliContext::failureLine(const Error& error) const {
    std::string message = errorMessage(error);
    if (isUsageError(error) || error.domain() == kInternalErrorDomain || verb_.empty())
        return message;
    std::string invocation = verb_;
    for (const auto& argument : arguments_) {
        if (argument.empty())
            continue;
        if (message.find(argument) != std::string::npos)
            return message;
        invocation += " " + argument;
    }
    return invocation + ": " + message;
}

int CliContext::fail(const Error& error, bool json) {
    if (json) {
        out_ << jsonText(errorJson(error)) << "\n";
    } else {
        err_ << "tamber: " << failureLine(error);
        if (verbose || debug)
            err_ << " (" << error.domain() << " " << error.code() << ")";
        err_ << "\n";
    }
    return exitStatusFor(error);
}

}  // namespace tamber
