#pragma once

#include "fs/TremorReader.h"
#include "fs/TremorReaderDelegate.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

// Judges one replay for TremorReader::canResumeGatherPhase: the first deletion, loss of
// history or end of history decides, stops the reader and wakes the waiting caller. Later
// reports of the same replay change nothing, so the caller reads a settled status.
class TremorChecker : public TremorReaderDelegate {
public:
    void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                         const std::optional<Url>& url) override;
    void readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier& identifier,
                         const std::optional<Url>& url) override;
    void readerDidProcessHistory(TremorReader& reader) override;
    void readerMustRescan(TremorReader& reader) override;
    void readerDidFinishBatch(TremorReader& reader) override;

    // Blocks until a report decided, then returns the verdict.
    TremorReaderGatherPhaseResumeStatus wait();

private:
    void decide(TremorReader& reader, const TremorReaderGatherPhaseResumeStatus* status);

    TremorReaderGatherPhaseResumeStatus gatherPhaseResumeStatus_;  // written before sema_ signals
    DispatchSemaphore sema_{0};
    bool decided_ = false;  // only on the reader's queue
};

}  // namespace tamber
