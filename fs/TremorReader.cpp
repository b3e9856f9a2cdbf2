#include "fs/TremorReader.h"

#include <algorithm>
#include <cstdio>
#include <map>

#include "applibraries/LocalAppLibraryManager.h"
#include "fs/CanonicalUUID.h"
#include "fs/DocIDPath.h"
#include "fs/FolderDescendants.h"
#include "fs/TremorChecker.h"
#include "host/HostPorterManager.h"
#include "host/PublishedTrees.h"
#include "host/UrlOperations.h"
#include "items/LocalAppLibraryItem.h"
#include "items/TBFileObjectIdentifier.h"
#include "items/TBPFileObjectIdentifier.h"
#include "platform/objects/Array.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "platform/tremors/Tremors.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

// Whether a removal event names a file ID that now belongs to an item elsewhere. A rename also
// finds its item elsewhere, but it is flagged as one; a removal that is not a rename can only
// find another item under the same number.
bool isReusedFileID(uint32_t flags, const Url& eventURL, const LocalItem& item) {
    return (flags & kTremorItemRemoved) && !(flags & kTremorItemRenamed) &&
           item.fileURL().path() != eventURL.path();
}

constexpr double kLatencySeconds = 0.5;
// Paths as objects, one event per file, and a {"path", "fileID"} dictionary per event.
constexpr uint32_t kCreateFlags =
    kTremorCreateUseObjects | kTremorCreateFileEvents | kTremorCreateUseExtendedData;

// The stream's info is a weak reference to its reader, which the stream's retain hook copies
// and its release hook deletes: the stream owns its copy for as long as it (or a batch it
// queued) lives, and a batch that outlives its reader finds nothing.
void* retainInfo(void* info) {
    return new std::weak_ptr<TremorReader>(*static_cast<std::weak_ptr<TremorReader>*>(info));
}
void releaseInfo(void* info) {
    delete static_cast<std::weak_ptr<TremorReader>*>(info);
}

std::string joinedPaths(const std::vector<Url>& urls) {
    std::string text = "[";
    for (size_t i = 0; i < urls.size(); ++i) {
        if (i > 0)
            text += ", ";
        text += urls[i].path();
    }
    return text + "]";
}

}  // namespace

const char* tremorReaderModeName(TremorReaderMode mode) {
    return mode == TremorReaderMode::docIDBased ? "docIDBased" : "pathBased";
}

std::shared_ptr<TremorReader> TremorReader::make(std::vector<Url> urls, uint64_t since,
                                                 TremorReaderMode mode, bool verbose) {
    return std::make_shared<TremorReader>(Private{}, std::move(urls), since, mode, verbose);
}

TremorReader::TremorReader(Private, std::vector<Url> urls, uint64_t since, TremorReaderMode mode,
                           bool verbose)
    : urls_(std::move(urls)),
      mode_(mode),
      verbose_(verbose),
      streamQueue_(DispatchQueue::makeSerial("tamber.tremors-stream")),
      lastProcessedTremorID_(since) {}

TremorReader::~TremorReader() {
    std::lock_guard lock(mutex_);
    if (!stream_)
        return;
    // The stream stays open (its owner broke the contract); its later batches find no reader.
    logError("stream deleted without being stopped; " + description());
}

void TremorReader::start() {
    if (verbose_)
        logDebug([&] { return "starting " + description(); });
    std::lock_guard lock(mutex_);
    if (stream_ || lostHistoryOwed_)
        return;  // already running
    stopping_.store(false);
    if (lastProcessedTremorID_.load() == TremorStream::kSinceNow) {
        // No journal hands out this ID, and a stream would take it for "from now on", whose
        // replay never ends: whatever anchor carried it, the history after it is unknown.
        lostHistoryOwed_ = true;
        streamQueue_->async([self = shared_from_this()] { self->reportLostHistory(); });
        return;
    }
    std::weak_ptr<TremorReader> self = weak_from_this();
    TremorStreamContext context;
    context.info = &self;  // the stream keeps its own copy
    context.retain = retainInfo;
    context.release = releaseInfo;
    uint64_t since = lastProcessedTremorID_.load();
    TremorStreamRef stream = nullptr;
    if (mode_ == TremorReaderMode::docIDBased) {
        Url storage = HostPorterManager::defaultManager()->documentStorageURL();
        uint32_t device = TBFileObjectIdentifier::deviceID(storage);
        stream = TremorStreamCreateRelativeToDevice(&TremorReader::streamCallback, &context, device,
                                                    {kTremorDocumentIdRoot}, since, kLatencySeconds,
                                                    kCreateFlags);
    } else {
        std::vector<std::string> paths;
        paths.reserve(urls_.size());
        for (const Url& url : urls_) paths.push_back(url.path());
        stream = TremorStreamCreate(&TremorReader::streamCallback, &context, paths, since,
                                    kLatencySeconds, kCreateFlags);
    }
    if (!stream) {
        fatalError("can't create tremor stream for " + description());
    }
    stream_ = stream;
    liveStream_.store(stream);
    TremorStreamSetDispatchQueue(stream, streamQueue_);
    if (!TremorStreamStart(stream)) {
        // A tree that can't be watched (gone, say) has no history to replay; a delegate that
        // waits for its end must hear so rather than wait for ever.
        logError("can't start tremor stream for " + description());
        lostHistoryOwed_ = true;
        streamQueue_->async([self = shared_from_this()] { self->reportLostHistory(); });
    }
}

void TremorReader::stop() {
    TremorStreamRef stream;
    {
        std::lock_guard lock(mutex_);
        lostHistoryOwed_ = false;
        if (!stream_)
            return;
        // From here on, batches the stream already queued are not the reader's stream's.
        stream = stream_;
        stream_ = nullptr;
        liveStream_.store(nullptr);
    }
    TremorStreamStop(stream);
    TremorStreamInvalidate(stream);
    TremorStreamRelease(stream);
    if (verbose_)
        logDebug([&] { return "stopped " + description(); });
}

void TremorReader::stopAfterCurrentEvent() {
    stopping_.store(true);
    // The stream's own stop ends its replay at the next batch; stop() releases it later. The
    // lock keeps a stop() on another thread from releasing it meanwhile.
    std::lock_guard lock(mutex_);
    if (stream_)
        TremorStreamStop(stream_);
}

void TremorReader::reportLostHistory() {
    {
        std::lock_guard lock(mutex_);
        if (!lostHistoryOwed_)
            return;  // stopped meanwhile
        lostHistoryOwed_ = false;
    }
    // The batch a stream sends when it cannot replay what was asked for.
    std::string path = urls_.empty() ? std::string(kTremorDocumentIdRoot) : urls_.front().path();
    std::map<std::string, ObjectRef> entry{{"path", String::make(path)}};
    ObjectRef paths = Array::make({Dictionary::make(std::move(entry))});
    const uint32_t flags = kTremorUserDropped | kTremorMustScanSubdirs;
    const uint64_t id = 0;
    receiveBatch(1, paths, &flags, &id);
}

void TremorReader::setDelegate(std::weak_ptr<TremorReaderDelegate> delegate) {
    std::lock_guard lock(mutex_);
    delegate_ = std::move(delegate);
}

std::shared_ptr<TremorReaderDelegate> TremorReader::delegate() const {
    std::lock_guard lock(mutex_);
    return delegate_.lock();
}

uint64_t TremorReader::lastProcessedTremorID() const {
    return lastProcessedTremorID_.load();
}

void TremorReader::recordEventID(uint64_t eventID) {
    lastProcessedTremorID_.store(eventID);
}

std::string TremorReader::description() const {
    char address[32];
    std::snprintf(address, sizeof address, "%p", static_cast<const void*>(this));
    return std::string("<TremorReader:") + address +
           " since:" + std::to_string(lastProcessedTremorID_.load()) +
           " urls:" + joinedPaths(urls_) + " mode:" + tremorReaderModeName(mode_) + ">";
}

uint64_t TremorReader::currentEventID() {
    return TremorsGetCurrentEventId();
}

std::optional<std::string> TremorReader::deviceUUID(const Url& url) {
    uint32_t device = TBFileObjectIdentifier::deviceID(url);
    return canonicalUUIDText(TremorsCopyUUIDForDevice(device));
}

std::pair<TremorReaderGatherPhaseResumeStatus, uint64_t> TremorReader::canResumeGatherPhase(
    const std::vector<Url>& urls, uint64_t previousEventID) {
    uint64_t current = currentEventID();
    auto reader = make(urls, previousEventID, TremorReaderMode::pathBased, false);
    auto checker = std::make_shared<TremorChecker>();
    reader->setDelegate(checker);
    // Never on the reader's queue: the replay that decides runs there.
    DispatchQueue::global()->async([reader] { reader->start(); });
    return {checker->wait(), current};
}

void TremorReader::streamCallback(TremorStreamRef stream, void* info, size_t numEvents,
                                  const ObjectRef& paths, const uint32_t* flags,
                                  const uint64_t* ids) {
    auto reader = static_cast<std::weak_ptr<TremorReader>*>(info)->lock();
    if (!reader)
        return;
    // A batch queued before the reader stopped (or restarted with a new stream) is dropped.
    if (reader->liveStream_.load() != stream)
        return;
    reader->receiveBatch(numEvents, paths, flags, ids);
}

void TremorReader::receiveBatch(size_t numEvents, const ObjectRef& paths, const uint32_t* flags,
                                const uint64_t* ids) {
    // The stream was made with extended data: one {"path", "fileID"} dictionary per event. An
    // entry that is not one has no path to report and is skipped like a pathless event.
    auto array = objectCast<Array>(paths);
    const size_t available = array ? std::min(numEvents, array->count()) : 0;
    if (verbose_)
        logDebug([&] { return "tremor: received " + std::to_string(numEvents) + " events"; });
    // Each entry is decoded once, for the preparation and for the reports.
    std::vector<BatchEntry> entries(available);
    for (size_t i = 0; i < available; ++i) {
        auto entry = objectCast<Dictionary>(array->objects()[i]);
        auto path = entry ? objectCast<String>(entry->objectForKey("path")) : nullptr;
        if (!path)
            continue;
        entries[i].path = &path->value();
        if (auto number = objectCast<Number>(entry->objectForKey("fileID")))
            entries[i].fileID = number->uint64Value();
    }
    // A batch names many files of a few folders: each folder is checked once.
    PublishedTrees::CheckedFolders checkedFolders;
    prepareBatch(entries, flags);
    for (size_t i = 0; i < available && !stopping_.load(); ++i) {
        if (!entries[i].path) {
            logError("ignore event " + std::to_string(ids[i]) +
                     " because no path can be extracted");
            continue;
        }
        processEvent(*entries[i].path, entries[i].fileID, flags[i], ids[i], i, numEvents);
    }
    batchItemsByFileID_.clear();
    batchItemsByPath_.clear();
    batchURLsByFileID_.clear();
    batchURLsByPath_.clear();
    if (auto target = delegate())
        target->readerDidFinishBatch(*this);
}

void TremorReader::processEvent(const std::string& path, std::optional<uint64_t> fileID,
                                uint32_t flags, uint64_t eventID, size_t index, size_t count) {
    streamQueue_->assertCurrent();
    // The title is only built when debug lines are written; the number is taken regardless.
    std::string title;
    if (Log::shared().debugEnabled()) {
        title = description() + " tremors: (" + std::to_string(index + 1) + "/" +
                std::to_string(count) + ") \"" + path +
                "\" fileID:" + (fileID ? std::to_string(*fileID) : std::string("unspecified")) +
                " eventID:" + std::to_string(eventID);
    }
    LogSection section(title);
    eventInProgress_ = eventID;
    classifyEvent(path, fileID, flags, eventID);
    eventInProgress_ = 0;
}

void TremorReader::classifyEvent(const std::string& path, std::optional<uint64_t> fileID,
                                 uint32_t flags, uint64_t eventID) {
    // Only the stream-level bits decide; per-item bits are ignored on purpose, since whether
    // the item can still be found tells creation, change and deletion apart.
    if (flags & kTremorEventIdsWrapped) {
        if (verbose_)
            logInfo("tremors id wrapped");
        if (auto target = delegate())
            target->readerMustRescan(*this);
    } else if (flags & (kTremorUserDropped | kTremorKernelDropped)) {
        if (verbose_)
            logInfo("dropped tremors");
        if (auto target = delegate())
            target->readerMustRescan(*this);
    } else if (flags & kTremorHistoryDone) {
        historyEnd_.store(eventID);
        if (verbose_)
            logDebug("done processing history");
        if (auto target = delegate())
            target->readerDidProcessHistory(*this);
    } else if (DocIDPath::mentionsDocumentIds(path)) {
        processDocIDEvent(path, eventID);
    } else {
        processPathEvent(path, fileID, flags, eventID);
    }
}

void TremorReader::processDocIDEvent(const std::string& path, uint64_t eventID) {
    auto parsed = DocIDPath::parse(path);
    if (!parsed) {
        logError("can't parse docID path \"" + path +
                 "\"; format expected is \"/.docid/$dev/changed/$docid/src=$src,dst=$dst\"");
        return;
    }
    HostPorterItemIdentifier identifier =
        TBPFileObjectIdentifier::fromDocumentID(parsed->documentID);
    if (parsed->destination == 0) {
        if (verbose_)
            logDebug([&] { return "did delete " + identifier; });
        if (auto target = delegate())
            target->readerDidDelete(*this, identifier, std::nullopt);
        recordEventID(eventID);
        return;
    }
    auto url = TBFileObjectIdentifier::fileURLWithFileIdentifier(parsed->destination);
    if (!url) {
        if (verbose_)
            logDebug([&] { return "can't compute url for " + identifier; });
        return;
    }
    bool monitored = false;
    for (const Url& root : urls_) {
        if (pt_relationshipToItemAtURL(root, *url) == UrlRelationship::Contains) {
            monitored = true;
            break;
        }
    }
    if (!monitored) {
        if (verbose_)
            logDebug(
                [&] { return "dropping tremor at " + url->path() + "; URL is not monitored"; });
        return;
    }
    if (isHidden(*url)) {
        if (verbose_)
            logDebug([&] { return "dropping tremor at " + url->path() + "; URL is hidden"; });
        return;
    }
    auto item = itemAt(*url);
    if (!item) {
        logError("dropping tremor at " + url->path() + "; can't create local item");
        return;
    }
    if (item->itemIdentifier() != identifier) {
        // The document ID now names another file; that is not a change of this document.
        if (verbose_) {
            logDebug([&] {
                return "dropping tremor at " + url->path() + "; fileObjectIDs don't match (" +
                       item->itemIdentifier() + " vs " + identifier + ")";
            });
        }
        return;
    }
    if (verbose_)
        logDebug([&] { return "did change " + item->description(); });
    if (auto target = delegate())
        target->readerDidChange(*this, item, std::nullopt);
    recordEventID(eventID);
}

void TremorReader::processPathEvent(const std::string& path, std::optional<uint64_t> fileID,
                                    uint32_t flags, uint64_t eventID) {
    Url url = Url::fileURLWithPath(path);
    if (isHidden(url)) {
        if (verbose_)
            logDebug([&] { return "dropping tremor at " + url.path() + "; URL is hidden"; });
        return;
    }
    if (url.lastPathComponent() == "Documents") {
        // An app library's root is reported as the library, not as a plain folder.
        if (auto record =
                LocalAppLibraryManager::shared()->bundleProxyFor(url, UrlRelationship::Same)) {
            if (auto library = LocalAppLibraryItem::initFrom(record)) {
                if (verbose_)
                    logDebug([&] { return "did change " + library->description(); });
                if (auto target = delegate())
                    target->readerDidChange(*this, library, url);
                recordEventID(eventID);
                return;
            }
        }
    }
    LocalItemRef item = fileID ? itemWithFileIdentifier(*fileID) : itemAt(url);
    if (item && isReusedFileID(flags, url, *item)) {
        // Linux hands a freed inode number to the next file made: the item that has this
        // file ID now is another one, and the one the event is about is gone.
        item = nullptr;
    }
    if (item) {
        if (verbose_)
            logDebug([&] { return "did change " + item->description(); });
        if (auto target = delegate())
            target->readerDidChange(*this, item, url);
        if ((flags & kTremorItemRenamed) && item->isFolder() && !item->isPackage())
            reportContentsCrossingTheTrash(*item, url);
    } else if (!fileID) {
        if (verbose_)
            logDebug([&] { return "dropping tremor at \"" + path + "\"; No object at path"; });
    } else {
        HostPorterItemIdentifier identifier = TBPFileObjectIdentifier::fromFileID(*fileID);
        if (verbose_)
            logDebug([&] { return "did delete " + identifier; });
        if (auto target = delegate())
            target->readerDidDelete(*this, identifier, url);
    }
    recordEventID(eventID);
}

void TremorReader::prepareBatch(const std::vector<BatchEntry>& entries, const uint32_t* flags) {
    constexpr uint32_t kStreamFlags =
        kTremorEventIdsWrapped | kTremorUserDropped | kTremorKernelDropped | kTremorHistoryDone;
    std::vector<Url> urls;
    // The storage's volume, looked up once for the batch's file IDs.
    std::optional<uint32_t> device;
    for (size_t i = 0; i < entries.size(); ++i) {
        // The same choices as classifyEvent and processPathEvent make.
        const std::string* path = entries[i].path;
        if ((flags[i] & kStreamFlags) || !path || DocIDPath::mentionsDocumentIds(*path))
            continue;
        Url url = Url::fileURLWithPath(*path);
        if (isHidden(url) || url.lastPathComponent() == "Documents")
            continue;
        if (const std::optional<uint64_t>& fileID = entries[i].fileID) {
            auto [it, inserted] = batchURLsByFileID_.try_emplace(*fileID);
            if (!inserted)
                continue;
            if (!device)
                device = TBFileObjectIdentifier::storageDeviceID();
            if (*device != 0)
                it->second = TBFileObjectIdentifier::_fileURLWithFileIdentifier(*fileID, *device);
            if (it->second && isHidden(*it->second))
                it->second.reset();  // another file's number now (see itemWithFileIdentifier)
            if (it->second)
                urls.push_back(*it->second);
        } else if (batchURLsByPath_.try_emplace(url.path(), url).second) {
            urls.push_back(url);
        }
    }
    if (!urls.empty())
        TBFileObjectIdentifier::prepareItemIdentifiers(urls);
}

LocalItemRef TremorReader::itemWithFileIdentifier(uint64_t fileID) {
    auto [it, inserted] = batchItemsByFileID_.try_emplace(fileID);
    if (inserted) {
        auto found = batchURLsByFileID_.find(fileID);
        std::optional<Url> url = found != batchURLsByFileID_.end()
                                     ? found->second
                                     : TBFileObjectIdentifier::fileURLWithFileIdentifier(fileID);
        // The number of a file gone is handed to the next file made, often a safe save's hidden
        // temporary file: made an item, that file would get a document ID, and the save would
        // then replace the document rather than carry its ID on.
        if (url && !isHidden(*url))
            it->second = LocalItem::make(*url);
    }
    return it->second;
}

LocalItemRef TremorReader::itemAt(const Url& url) {
    auto [it, inserted] = batchItemsByPath_.try_emplace(url.path());
    if (inserted) {
        auto found = batchURLsByPath_.find(url.path());
        it->second = LocalItem::make(found != batchURLsByPath_.end() ? found->second : url);
    }
    return it->second;
}

void TremorReader::reportContentsCrossingTheTrash(const LocalItem& folder, const Url& eventURL) {
    // The working set holds a trash's top level but not what trashed folders hold: their
    // contents leave it with them and come back when they are put back.
    bool trashed = isTrashTop(folder.fileURL());
    if (!trashed && !isTrashTop(eventURL))
        return;
    auto target = delegate();
    if (!target)
        return;
    forEachVisibleDescendant(folder.fileURL(), [&](const Url& url) {
        LocalItemRef item = LocalItem::make(url);
        if (!item)
            return false;
        if (trashed)
            target->readerDidDelete(*this, item->itemIdentifier(), url);
        else
            target->readerDidChange(*this, item, url);
        return !item->isPackage();
    });
}

bool TremorReader::isTrashTop(const Url& url) const {
    std::vector<std::string> components = url.pathComponents();
    for (const Url& root : urls_) {
        std::vector<std::string> rootComponents = root.pathComponents();
        if (rootComponents.size() + 2 == components.size() &&
            std::equal(rootComponents.begin(), rootComponents.end(), components.begin()) &&
            components[rootComponents.size()] == ".Trash")
            return true;
    }
    return false;
}

bool TremorReader::isHidden(const Url& url) const {
    streamQueue_->assertCurrent();
    std::vector<std::string> components = url.pathComponents();
    for (const Url& root : urls_) {
        std::vector<std::string> rootComponents = root.pathComponents();
        if (rootComponents.size() > components.size() ||
            !std::equal(rootComponents.begin(), rootComponents.end(), components.begin()))
            continue;
        for (size_t i = rootComponents.size(); i < components.size(); ++i) {
            if (components[i].empty() || components[i][0] != '.')
                continue;
            // The top level of a root's trash is in the working set: what leaves it must be
            // told, or a trashed folder deleted for good would stay in the host's view.
            bool trashTop = i == rootComponents.size() && components[i] == ".Trash" &&
                            i + 2 == components.size() && !components[i + 1].empty() &&
                            components[i + 1][0] != '.';
            if (!trashTop)
                return true;
            ++i;
        }
        return false;
    }
    return false;
}

}  // namespace tamber
