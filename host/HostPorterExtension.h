#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "host/HostPorterEnumerator.h"
#include "host/HostPorterItem.h"
#include "platform/Url.h"
#include "platform/objects/Data.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "support/Result.h"

namespace tamber {

// The host framework's answer to an operation a provider does not implement.
inline constexpr int64_t kHostPorterFeatureUnsupported = -2001;

// The base class of a storage provider, and the whole surface a host uses: a host (the command
// line, a server, a test) holds a `HostPorterExtension&` and nothing more specific. The host
// calls these on its own threads, possibly at the same time. The defaults describe a provider
// that publishes nothing and supports no operation: lookups find nothing, and every operation
// calls its completion exactly once, on the caller's thread, with the unsupported error.
class HostPorterExtension {
public:
    virtual ~HostPorterExtension() = default;

    // The error the defaults complete with; `operation` names what was asked.
    static Error unsupportedOperationError(const std::string& operation);

    // Lookups.
    virtual Result<HostPorterItemRef> itemForIdentifier(const HostPorterItemIdentifier& identifier);
    virtual std::optional<Url> URLForItemWithPersistentIdentifier(
        const HostPorterItemIdentifier& identifier);
    virtual std::optional<HostPorterItemIdentifier> persistentIdentifierForItemAtURL(
        const Url& url);
    // The item at a path inside the published trees, for hosts that let people name items by
    // path. Fails for a path outside them or one that names no item.
    virtual Result<HostPorterItemRef> itemAtURL(const Url& url);
    virtual Result<HostPorterEnumeratorRef> enumeratorForContainerItemIdentifier(
        const HostPorterItemIdentifier& identifier);

    // Files are local: nothing to download or materialise.
    virtual void providePlaceholderAtURL(const Url& url,
                                         std::function<void(std::optional<Error>)> completion);
    virtual void startProvidingItemAtURL(const Url& url,
                                         std::function<void(std::optional<Error>)> completion);
    virtual void itemChangedAtURL(const Url& url);
    virtual void stopProvidingItemAtURL(const Url& url);

    // Item operations. Every completion is called exactly once, with an item or an error, on
    // whatever thread the operation finishes.
    using ItemCompletion = std::function<void(Result<HostPorterItemRef> item)>;
    using ErrorCompletion = std::function<void(Status status)>;
    virtual void importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                                     ItemCompletion completion);
    // A taken name bounces to "name 2", ... (as a file browser's new folder does); with
    // `bounce` false it fails with EEXIST instead.
    virtual void createDirectoryWithName(const std::string& name,
                                         const HostPorterItemIdentifier& parent,
                                         ItemCompletion completion);
    virtual void createDirectoryWithName(const std::string& name,
                                         const HostPorterItemIdentifier& parent, bool bounce,
                                         ItemCompletion completion);
    virtual void renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                          const std::string& name, ItemCompletion completion);
    virtual void reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                            const HostPorterItemIdentifier& parent,
                                            const std::optional<std::string>& newName,
                                            ItemCompletion completion);
    virtual void deleteItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                          ErrorCompletion completion);

    // Trash and put-back.
    virtual void trashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                         ItemCompletion completion);
    virtual void untrashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                           const std::optional<HostPorterItemIdentifier>& parent,
                                           ItemCompletion completion);
    // Deletes for good what was trashed before `referenceDate`; `completion` gets how many
    // trashed items were deleted, once every deletion has finished.
    virtual void removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                                 std::function<void(size_t removed)> completion);

    // Metadata.
    virtual void setLastUsedDate(std::shared_ptr<const Date> date,
                                 const HostPorterItemIdentifier& identifier,
                                 ItemCompletion completion);
    virtual void setTagData(const std::optional<Bytes>& tagData,
                            const HostPorterItemIdentifier& identifier, ItemCompletion completion);
    virtual void setFavoriteRank(std::shared_ptr<const Number> rank,
                                 const HostPorterItemIdentifier& identifier,
                                 ItemCompletion completion);

    // Thumbnails: `perThumbnailCompletion` once for each identifier the provider has an answer
    // for, then `completion` once.
    struct ThumbnailSize {
        double width = 0;
        double height = 0;
    };
    using PerThumbnailCompletion =
        std::function<void(const HostPorterItemIdentifier& identifier, std::optional<Bytes> png,
                           std::optional<Error> error)>;
    using PerThumbnailCompletionWithType =
        std::function<void(const HostPorterItemIdentifier& identifier, std::optional<Bytes> png,
                           const std::string& typeIdentifier, std::optional<Error> error)>;
    virtual void fetchThumbnailsForItemIdentifiers(
        const std::vector<HostPorterItemIdentifier>& identifiers, ThumbnailSize requestedSize,
        PerThumbnailCompletion perThumbnailCompletion, ErrorCompletion completion);
    virtual void fetchThumbnailsForItemIdentifiers(
        const std::vector<HostPorterItemIdentifier>& identifiers, ThumbnailSize requestedSize,
        PerThumbnailCompletionWithType perThumbnailCompletion, ErrorCompletion completion);

    // Apps: the library item of one app, and a refresh of the installed apps whose completion
    // runs after the next refresh (the default has nothing to refresh and completes at once).
    virtual void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                                ItemCompletion completion);
    virtual void refreshInstalledAppsWithCompletionHandler(std::function<void()> completion);
};

}  // namespace tamber
