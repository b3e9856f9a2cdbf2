#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/tremors/TremorFlags.h"
#include "platform/tremors/TremorStream.h"
#include "support/DispatchQueue.h"

namespace tamber {

// The platform's event-stream calls, over the process's TremorService. Creation fails (null)
// when the service cannot start.
//
// `sinceWhen` is an event ID, or TremorStream::kSinceNow (all bits set) for live events only:
// no journal hands that ID out, so callers holding an ID from outside (an anchor, a page
// token, a command line) must not pass it on as it is. A stream from an ID past the journal's
// last event sends a lost-history event (0x02) and then the history-done event, nothing else.
TremorStreamRef TremorStreamCreate(TremorStreamCallback callback,
                                   const TremorStreamContext* context,
                                   const std::vector<std::string>& pathsToWatch, uint64_t sinceWhen,
                                   double latencySeconds, uint32_t flags);
TremorStreamRef TremorStreamCreateRelativeToDevice(
    TremorStreamCallback callback, const TremorStreamContext* context, uint32_t device,
    const std::vector<std::string>& pathsRelativeToDevice, uint64_t sinceWhen,
    double latencySeconds, uint32_t flags);
// The same stream for the program's own consumers of the journal (`tamber events`, a server):
// the callback gets the events as records (ID, path, inode, flags) instead of an array of
// dictionaries to decode. With `device`, `paths` are relative to that volume.
TremorStreamRef TremorStreamCreateWithEvents(TremorStream::EventsCallback callback,
                                             std::optional<uint32_t> device,
                                             const std::vector<std::string>& paths,
                                             uint64_t sinceWhen, double latencySeconds,
                                             uint32_t flags);
void TremorStreamSetDispatchQueue(TremorStreamRef stream, std::shared_ptr<DispatchQueue> queue);
// False when the stream is running, invalidated, has no queue or its trees cannot be watched.
// A stopped stream may be started again: it goes on after the last event it delivered.
bool TremorStreamStart(TremorStreamRef stream);
void TremorStreamStop(TremorStreamRef stream);
void TremorStreamInvalidate(TremorStreamRef stream);
void TremorStreamRelease(TremorStreamRef stream);

// The last event ID handed out, after the events already queued by the kernel are journaled.
uint64_t TremorsGetCurrentEventId();
// The UUID of the journal of `device`; empty when none of its trees is watched.
std::string TremorsCopyUUIDForDevice(uint32_t device);

}  // namespace tamber
