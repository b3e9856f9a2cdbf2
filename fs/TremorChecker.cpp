#include "fs/TremorChecker.h"

namespace tamber {

void TremorChecker::readerDidChange(TremorReader& reader, const LocalItemRef&,
                                    const std::optional<Url>&) {
    reader.streamQueue()->assertCurrent();
}

void TremorChecker::readerDidDelete(TremorReader& reader,
                                    const HostPorterItemIdentifier& identifier,
                                    const std::optional<Url>& url) {
    reader.streamQueue()->assertCurrent();
    TremorReaderGatherPhaseResumeStatus status;
    status.kind = TremorReaderGatherPhaseResumeStatus::Kind::deletionOccurred;
    status.deletion = "[" + identifier;
    if (url)
        status.deletion += ", path:'" + url->path() + "'";
    status.deletion += "]";
    decide(reader, &status);
}

void TremorChecker::readerDidProcessHistory(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
    decide(reader, nullptr);
}

void TremorChecker::readerMustRescan(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
    TremorReaderGatherPhaseResumeStatus status;
    status.kind = TremorReaderGatherPhaseResumeStatus::Kind::cantReplayHistoricalTremors;
    decide(reader, &status);
}

void TremorChecker::readerDidFinishBatch(TremorReader& reader) {
    reader.streamQueue()->assertCurrent();
}

TremorReaderGatherPhaseResumeStatus TremorChecker::wait() {
    sema_.wait();
    return gatherPhaseResumeStatus_;
}

void TremorChecker::decide(TremorReader& reader,
                           const TremorReaderGatherPhaseResumeStatus* status) {
    if (decided_)
        return;
    decided_ = true;
    if (status)
        gatherPhaseResumeStatus_ = *status;
    // We run inside the reader's own callback: stopping must wait until it returns.
    reader.streamQueue()->async([self = reader.shared_from_this()] { self->stop(); });
    sema_.signal();
}

}  // namespace tamber
