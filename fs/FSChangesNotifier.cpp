#include "fs/FSChangesNotifier.h"

#include "host/HostPorterManager.h"
#include "support/Log.h"

namespace tamber {

std::shared_ptr<FSChangesNotifier> FSChangesNotifier::make(HostPorterItemIdentifier container,
                                                           std::vector<Url> urls) {
    if (urls.empty())
        fatalError("require at least one URL to init a change notifier");
    auto uuid = TremorReader::deviceUUID(urls.front());
    if (!uuid) {
        logError("can't get volume UUID for \"" + urls.front().path() + "\"");
        return nullptr;
    }
    // Only what happens from now on needs a signal; the history is the enumerators' business.
    auto reader = TremorReader::make(std::move(urls), TremorReader::currentEventID(),
                                     TremorReaderMode::pathBased, true);
    auto notifier =
        std::make_shared<FSChangesNotifier>(Private{}, std::move(container), reader, *uuid);
    reader->setDelegate(notifier);
    return notifier;
}

FSChangesNotifier::FSChangesNotifier(Private, HostPorterItemIdentifier container,
                                     TremorReaderRef reader, std::string deviceUUID)
    : container_(std::move(container)),
      reader_(std::move(reader)),
      deviceUUID_(std::move(deviceUUID)) {}

void FSChangesNotifier::start() {
    reader_->start();
}

void FSChangesNotifier::stop() {
    reader_->stop();
}

void FSChangesNotifier::notifyChangesOnContainer(const HostPorterItemIdentifier& container) {
    logInfo("notify changes on " + container);
    HostPorterManager::defaultManager()->signalEnumeratorForContainerItemIdentifier(
        container, [](std::optional<Error>) {});
}

void FSChangesNotifier::readerDidChange(TremorReader& reader, const LocalItemRef&,
                                        const std::optional<Url>&) {
    reader.streamQueue()->assertCurrent();
    shouldSignalChange_ = true;
}

void FSChangesNotifier::readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier&,
                                        const std::optional<Url>&) {
    reader.streamQueue()->assertCurrent();
    shouldSignalChange_ = true;
}

void FSChangesNotifier::readerDidProcessHistory(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
}

void FSChangesNotifier::readerMustRescan(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
    shouldSignalChange_ = true;
}

void FSChangesNotifier::readerDidFinishBatch(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
    // Left set on purpose: once something changed, every later batch signals too.
    if (!shouldSignalChange_)
        return;
    notifyChangesOnContainer(container_ == HostPorterWorkingSetContainerItemIdentifier
                                 ? HostPorterWorkingSetContainerItemIdentifier
                                 : HostPorterRootContainerItemIdentifier);
}

}  // namespace tamber
