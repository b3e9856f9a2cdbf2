#pragma once

#include <optional>

#include "host/HostPorterItemIdentifier.h"
#include "items/LocalItem.h"
#include "platform/Url.h"

namespace tamber {

class TremorReader;

// Receives what a reader made of the event stream. Every call runs on the reader's
// `streamQueue`.
class TremorReaderDelegate {
public:
    virtual ~TremorReaderDelegate() = default;
    // An item was created or changed and is published. `url` is the event's URL for path
    // events, empty for document-ID events.
    virtual void readerDidChange(TremorReader& reader, const LocalItemRef& item,
                                 const std::optional<Url>& url) = 0;
    // An item disappeared. `url` is empty for document-ID events.
    virtual void readerDidDelete(TremorReader& reader, const HostPorterItemIdentifier& identifier,
                                 const std::optional<Url>& url) = 0;
    // The replay of history is complete; live events follow.
    virtual void readerDidProcessHistory(TremorReader& reader) = 0;
    // Events were dropped or event IDs wrapped: history can't be trusted, rescan.
    virtual void readerMustRescan(TremorReader& reader) = 0;
    // After every batch the stream delivered.
    virtual void readerDidFinishBatch(TremorReader& reader) = 0;
};

}  // namespace tamber
