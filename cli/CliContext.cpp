#include "cli/CliContext.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ostream>
#include <utility>

#include "cli/RemotePorter.h"
#include "cli/ServerClient.h"
#include "host/PublishedTrees.h"
#include "provider/LocalPorterError.h"
#include "runtime/HostJson.h"
#include "runtime/JsonValues.h"
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
    if (runtime_)
        runtime_->shutdown();
}

Status CliContext::prepareStorage() {
    return runtime().prepareStorage();
}

Status CliContext::publishFromCache() {
    return runtime().publishFromCache();
}

ProviderRuntime& CliContext::runtime() {
    if (runtime_)
        return *runtime_;
    ProviderRuntimeOptions options;
    // The process stops the journal once, when it exits; tests run verb after verb in one
    // process as separate runs of the same program.
    options.journal = ProviderRuntimeOptions::Journal::ProcessWide;
    options.storagePath = storagePath;
    options.lockWaitSeconds = waitSeconds;
    std::weak_ptr<WaitNotice> weakNotice = waitNotice_;
    options.onLockWait = [weakNotice](pid_t holder, const std::string& directory) {
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
    };
    runtime_ = std::make_unique<ProviderRuntime>(std::move(options));
    return *runtime_;
}

namespace {

const Url& noStorage() {
    static const Url none;
    return none;
}

const LocalPorter::AppRefreshOutcome& noRefresh() {
    static const LocalPorter::AppRefreshOutcome none;
    return none;
}

}  // namespace

const Url& CliContext::storageURL() const {
    return runtime_ ? runtime_->storageURL() : noStorage();
}

const LocalPorter::AppRefreshOutcome& CliContext::appRefreshOutcome() const {
    return runtime_ ? runtime_->appRefreshOutcome() : noRefresh();
}

Result<std::shared_ptr<TremorService>> CliContext::startJournal() {
    if (auto error = prepareStorage(); !error.ok())
        return error.error();
    return runtime_->startJournal();
}

Status CliContext::prepareJournal() {
    return runtime().prepareJournal();
}

Result<std::shared_ptr<LocalPorter>> CliContext::prepareProvider() {
    return runtime().provider();
}

Status CliContext::discoverServer() {
    server_ = RunFile::liveServerFor(runFile, storageURL().path());
    if (!server_ || !direct)
        return Status::OK();
    const std::string pid = std::to_string(server_->pid);
    return Error(
        kPosixErrorDomain, EBUSY,
        {{"description", "--direct: the Tamber server (pid " + pid +
                             ") holds the event journal of " + storageURL().path() +
                             "; stop it (kill " + pid + ") or run the verb without --direct"}});
}

Result<std::shared_ptr<RemotePorter>> CliContext::remoteProvider() {
    if (remote_ || !server_)
        return remote_;
    if (auto published = publishFromCache(); !published.ok())
        return published.error();
    remote_ = std::make_shared<RemotePorter>(std::make_shared<ServerClient>(*server_));
    return remote_;
}

void CliContext::setSignalHandler(SignalHandler handler) {
    runtime().setSignalHandler(std::move(handler));
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
    return HostJson::error(error);
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
