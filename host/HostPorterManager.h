#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "host/HostPorterItemIdentifier.h"
#include "platform/Url.h"
#include "support/Error.h"

namespace tamber {

// The host's side of the provider: where the document storage is, and how the provider tells
// the host that a container changed. A host installs the process-wide default before the
// provider starts; tests install a recording one.
class HostPorterManager {
public:
    using Completion = std::function<void(std::optional<Error>)>;

    virtual ~HostPorterManager() = default;

    // Stops the process (a programming error) when no manager was installed.
    static std::shared_ptr<HostPorterManager> defaultManager();
    // The installed manager, or null: for code that also serves walks where no provider runs.
    static std::shared_ptr<HostPorterManager> installedManager();
    // Returns the previous manager.
    static std::shared_ptr<HostPorterManager> installDefaultManager(
        std::shared_ptr<HostPorterManager> manager);

    virtual Url documentStorageURL() const = 0;
    virtual void signalEnumeratorForContainerItemIdentifier(
        const HostPorterItemIdentifier& container, Completion completion) = 0;
    virtual void deleteSearchableItemsWithDomainIdentifiers(
        const std::vector<std::string>& domainIdentifiers, Completion completion) = 0;
};

// The manager a host runtime installs: a fixed storage folder, signals passed to a handler of
// the host's (none: they are accepted and dropped), and index deletions passed to another (none:
// nothing is indexed, so they complete at once).
class StorageHostPorterManager : public HostPorterManager {
public:
    using SignalHandler = std::function<void(const HostPorterItemIdentifier&)>;
    using IndexDeletionHandler =
        std::function<void(const std::vector<std::string>& domainIdentifiers, Completion)>;

    explicit StorageHostPorterManager(Url documentStorage, SignalHandler onSignal = {},
                                      IndexDeletionHandler onDeleteIndex = {});

    Url documentStorageURL() const override { return storage_; }
    void signalEnumeratorForContainerItemIdentifier(const HostPorterItemIdentifier& container,
                                                    Completion completion) override;
    void deleteSearchableItemsWithDomainIdentifiers(
        const std::vector<std::string>& domainIdentifiers, Completion completion) override;

private:
    Url storage_;
    SignalHandler onSignal_;
    IndexDeletionHandler onDeleteIndex_;
};

}  // namespace tamber
