#pragma once

#include <optional>
#include <vector>

#include "host/HostPorterItem.h"
#include "host/HostPorterPage.h"
#include "support/Error.h"

namespace tamber {

// Receives one page of a listing. Exactly one of the two finish calls ends the page.
class HostPorterEnumerationObserver {
public:
    virtual ~HostPorterEnumerationObserver() = default;
    virtual void didEnumerateItems(const std::vector<HostPorterItemRef>& items) = 0;
    // Nothing as the next page means the listing is complete.
    virtual void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& nextPage) = 0;
    virtual void finishEnumeratingWithError(const Error& error) = 0;
    virtual size_t suggestedPageSize() const { return 200; }
};

}  // namespace tamber
