#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterItem.h"
#include "platform/Url.h"
#include "support/Result.h"

namespace tamber {

// The base class of a storage provider. The host calls these on its own threads, possibly at
// the same time. The defaults describe a provider that publishes nothing; a provider overrides
// what it serves.
class HostPorterExtension {
public:
    virtual ~HostPorterExtension() = default;

    virtual Result<HostPorterItemRef> itemForIdentifier(const HostPorterItemIdentifier& identifier);
    virtual std::optional<Url> URLForItemWithPersistentIdentifier(
        const HostPorterItemIdentifier& identifier);
    virtual std::optional<HostPorterItemIdentifier> persistentIdentifierForItemAtURL(
        const Url& url);
    virtual Result<HostPorterEnumeratorRef> enumeratorForContainerItemIdentifier(
        const HostPorterItemIdentifier& identifier);

    // Files are local: nothing to download or materialise.
    virtual void providePlaceholderAtURL(const Url& url,
                                         std::function<void(std::optional<Error>)> completion);
    virtual void startProvidingItemAtURL(const Url& url,
                                         std::function<void(std::optional<Error>)> completion);
    virtual void itemChangedAtURL(const Url& url);
    virtual void stopProvidingItemAtURL(const Url& url);
};

}  // namespace tamber
