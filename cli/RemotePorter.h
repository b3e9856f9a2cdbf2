#pragma once

#include <memory>
#include <optional>
#include <string>

#include <nlohmann/json.hpp>

#include "host/HostPorterExtension.h"

namespace tamber {

class ServerClient;

// The provider of a running server, as the verbs see it: every lookup and operation is one
// request to the server's API, and its answer (item, page, error) is rebuilt so that the verb
// prints exactly what it prints when it runs the provider itself. Completions run on the
// caller's thread before the call returns.
class RemotePorter : public HostPorterExtension {
public:
    explicit RemotePorter(std::shared_ptr<ServerClient> client);

    ServerClient& client() { return *client_; }

    Result<HostPorterItemRef> itemForIdentifier(
        const HostPorterItemIdentifier& identifier) override;
    std::optional<Url> URLForItemWithPersistentIdentifier(
        const HostPorterItemIdentifier& identifier) override;
    std::optional<HostPorterItemIdentifier> persistentIdentifierForItemAtURL(
        const Url& url) override;
    Result<HostPorterItemRef> itemAtURL(const Url& url) override;
    Result<HostPorterEnumeratorRef> enumeratorForContainerItemIdentifier(
        const HostPorterItemIdentifier& identifier) override;

    void importDocumentAtURL(const Url& source, const HostPorterItemIdentifier& parent,
                             ItemCompletion completion) override;
    using HostPorterExtension::createDirectoryWithName;
    void createDirectoryWithName(const std::string& name, const HostPorterItemIdentifier& parent,
                                 bool bounce, ItemCompletion completion) override;
    void renameItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                  const std::string& name, ItemCompletion completion) override;
    void reparentItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                    const HostPorterItemIdentifier& parent,
                                    const std::optional<std::string>& newName,
                                    ItemCompletion completion) override;
    void deleteItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                  ErrorCompletion completion) override;
    void trashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                 ItemCompletion completion) override;
    void untrashItemWithIdentifier(const HostPorterItemIdentifier& identifier,
                                   const std::optional<HostPorterItemIdentifier>& parent,
                                   ItemCompletion completion) override;
    void removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                         std::function<void(size_t removed)> completion) override;
    void setLastUsedDate(std::shared_ptr<const Date> date,
                         const HostPorterItemIdentifier& identifier,
                         ItemCompletion completion) override;
    void setTagData(const std::optional<Bytes>& tagData, const HostPorterItemIdentifier& identifier,
                    ItemCompletion completion) override;
    void setFavoriteRank(std::shared_ptr<const Number> rank,
                         const HostPorterItemIdentifier& identifier,
                         ItemCompletion completion) override;
    using HostPorterExtension::fetchThumbnailsForItemIdentifiers;
    void fetchThumbnailsForItemIdentifiers(const std::vector<HostPorterItemIdentifier>& identifiers,
                                           ThumbnailSize requestedSize,
                                           PerThumbnailCompletion perThumbnailCompletion,
                                           ErrorCompletion completion) override;
    void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                        ItemCompletion completion) override;
    void refreshInstalledAppsWithCompletionHandler(std::function<void()> completion) override;

    // What the last operation whose completion cannot carry an error (a purge, a refresh)
    // failed with, if it did; the verb reports it.
    std::optional<Error> lastError() const { return lastError_; }

private:
    static std::string itemPath(const HostPorterItemIdentifier& identifier);
    Result<HostPorterItemRef> itemFrom(const Result<nlohmann::json>& answer);
    void patch(const HostPorterItemIdentifier& identifier, const nlohmann::json& changes,
               ItemCompletion& completion);

    std::shared_ptr<ServerClient> client_;
    std::optional<Error> lastError_;
};

}  // namespace tamber
