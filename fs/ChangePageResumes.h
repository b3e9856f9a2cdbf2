#pragma once

#include <cstdint>
#include <list>
#include <optional>
#include <string>
#include <vector>

#include "fs/FSChangeToken.h"
#include "fs/TremorReader.h"
#include "host/HostPorterItemIdentifier.h"
#include "support/Mutex.h"

namespace tamber {

// Where the requests for changes that filled a page stopped. The next request for the same
// history carries the page's offset and would replay everything from the anchor's event again,
// building an item for every change it then skips: quadratic in the history, minutes for
// 10,000 changes. It goes on from the event that filled the page instead. A few points are
// kept, the oldest dropped first.
class ChangePageResumes {
public:
    struct Point {
        TremorReaderMode mode;  // the pass that filled the page
        uint64_t eventID;       // the event whose report filled it
        uint64_t maxTremorID;   // what a finished earlier pass reached
    };

    static ChangePageResumes& shared();

    // A page of `container` over `urls`, from the history `token` names up to its offset.
    static std::string keyFor(const FSChangeToken& token, const HostPorterItemIdentifier& container,
                              const std::vector<Url>& urls);

    void keep(std::string key, Point point);
    // The point for `key`, once: a page is asked for again only when its answer was lost.
    std::optional<Point> take(const std::string& key);

private:
    static constexpr size_t kMaxPoints = 16;
    Mutex mutex_;
    std::list<std::pair<std::string, Point>> points_ GUARDED_BY(mutex_);  // newest first
};

}  // namespace tamber
