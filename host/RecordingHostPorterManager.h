#pragma once

#include <vector>

#include "host/HostPorterManager.h"
#include "support/Mutex.h"

namespace tamber {

// A manager for tests: answers a given storage folder and records every signal and deletion
// request, completing each at once (or with a preset error).
class RecordingHostPorterManager : public HostPorterManager {
public:
    explicit RecordingHostPorterManager(Url documentStorage);

    Url documentStorageURL() const override;
    void signalEnumeratorForContainerItemIdentifier(const HostPorterItemIdentifier& container,
                                                    Completion completion) override;
    void deleteSearchableItemsWithDomainIdentifiers(
        const std::vector<std::string>& domainIdentifiers, Completion completion) override;

    std::vector<HostPorterItemIdentifier> signals() const;
    std::vector<std::vector<std::string>> deletions() const;
    void setStorageURL(Url url);
    void setSignalError(std::optional<Error> error);
    void clear();

private:
    mutable Mutex mutex_;
    Url storage_ GUARDED_BY(mutex_);
    std::vector<HostPorterItemIdentifier> signals_ GUARDED_BY(mutex_);
    std::vector<std::vector<std::string>> deletions_ GUARDED_BY(mutex_);
    std::optional<Error> signalError_ GUARDED_BY(mutex_);
};

}  // namespace tamber
