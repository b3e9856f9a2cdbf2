#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Object.h"
#include "support/Result.h"

namespace tamber {

class OpenFolder;

// Resource keys and the names they are known by (in logs and caches).
using ResourceKey = std::string_view;
namespace ResourceKeys {
inline constexpr ResourceKey kName = "HostURLNameKey";
inline constexpr ResourceKey kLocalizedName = "HostURLLocalizedNameKey";
inline constexpr ResourceKey kParentDirectoryURL = "HostURLParentDirectoryURLKey";
inline constexpr ResourceKey kTypeIdentifier = "HostURLTypeIdentifierKey";
inline constexpr ResourceKey kFileSize = "HostURLFileSizeKey";
inline constexpr ResourceKey kCreationDate = "HostURLCreationDateKey";
inline constexpr ResourceKey kContentModificationDate = "HostURLContentModificationDateKey";
inline constexpr ResourceKey kIsReadable = "HostURLIsReadableKey";
inline constexpr ResourceKey kIsWritable = "HostURLIsWritableKey";
inline constexpr ResourceKey kIsDirectory = "HostURLIsDirectoryKey";
inline constexpr ResourceKey kIsPackage = "HostURLIsPackageKey";
inline constexpr ResourceKey kIsSymbolicLink = "HostURLIsSymbolicLinkKey";
inline constexpr ResourceKey kLinkCount = "HostURLLinkCountKey";
inline constexpr ResourceKey kFileID = "_kHostURLFileIDKey";
// The device number (dev_t) of the volume that holds the item itself (a mount point's own).
inline constexpr ResourceKey kVolumeIdentifier = "HostURLVolumeIdentifierKey";
inline constexpr ResourceKey kIsRegularFile = "HostURLIsRegularFileKey";
inline constexpr ResourceKey kDocumentID = "HostURLDocumentIdentifierKey";
}  // namespace ResourceKeys

// A URL; for file URLs an absolute, lexically standardised path. It carries a resource-value
// cache that belongs to the URL object: copies of a Url share it (they are the same object), a
// derived URL (appending, deleting a component) starts empty. Values stored in the cache are
// never written to disk. Safe to use from several threads.
class Url {
public:
    Url();  // an empty, non-file URL

    // `path` made absolute (against the working directory) and standardised: repeated and
    // trailing slashes, "." and ".." resolved lexically (no symbolic links are read).
    static Url fileURLWithPath(std::string_view path);
    // The child `name` of an open folder. While the folder stays open, the URL's resource values
    // are read relative to it.
    static Url fileURLInFolder(const std::shared_ptr<const OpenFolder>& folder,
                               std::string_view name);
    // The open folder the URL was made in, or null (never made in one, or closed since).
    std::shared_ptr<const OpenFolder> openFolder() const;
    // "file:///a%20b" or any other "scheme:..." string; nothing when it is not a URL.
    static std::optional<Url> parse(std::string_view string);

    bool isFileURL() const;
    bool isEmpty() const;
    const std::string& path() const;        // for file URLs; empty otherwise
    std::string absoluteString() const;     // "file:///..." percent-encoded, or the URL text
    std::string lastPathComponent() const;  // "/" for the root
    std::string pathExtension() const;      // without the dot; empty when none
    std::vector<std::string> pathComponents() const;  // "/" first, then each component
    Url deletingLastPathComponent() const;
    Url appendingPathComponent(std::string_view component) const;

    // Reads a resource value: from the cache, else from the file system (one statx serves all
    // the status-based keys of one fetch). An ok result holding null means "no value" (a
    // creation date on a file system without birth times, a document ID not yet known). A
    // missing file is HostPlatformErrorDomain code 260.
    Result<ObjectRef> resourceValue(ResourceKey key) const;
    // Stores a value in the cache. Only the file ID and document ID keys may be set.
    Status setResourceValue(const ObjectRef& value, ResourceKey key) const;
    // Fetches several keys at once into the cache (what directory walks prefetch).
    Status prefetchResourceValues(const std::vector<ResourceKey>& keys) const;
    void removeCachedResourceValue(ResourceKey key) const;
    void removeAllCachedResourceValues() const;

    // Same scheme and path (file URLs) or same text.
    friend bool operator==(const Url& a, const Url& b);
    friend bool operator<(const Url& a, const Url& b);

    struct Storage;

private:
    explicit Url(std::shared_ptr<Storage> storage);
    std::shared_ptr<Storage> storage_;
};

// A Url as an Object, for the parent-directory resource value.
class UrlObject : public Object {
public:
    static constexpr std::string_view kClassName = "URL";
    explicit UrlObject(Url url) : url_(std::move(url)) {}
    const Url& url() const { return url_; }
    std::string_view className() const override { return kClassName; }
    std::string description() const override { return url_.absoluteString(); }
    bool isEqual(const Object& other) const override;

private:
    Url url_;
};

// Where document IDs come from when none is cached. The document-ID service installs one; until
// then the document-ID key has no value.
using DocumentIdLookup = std::optional<uint32_t> (*)(const std::string& path);
void setDocumentIdLookup(DocumentIdLookup lookup);

}  // namespace tamber
