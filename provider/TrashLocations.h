#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Url.h"
#include "platform/objects/Date.h"
#include "support/Result.h"

namespace tamber {

// Where trashed items go and where they come back to. Shared by trashing, untrashing, the
// trash sweep and the put-back resolver that item records use.

// The path components of `url` ("/" first) up to and including the first one named
// "Documents", or nothing when there is none.
std::optional<std::vector<std::string>> componentsThroughFirstDocuments(const Url& url);
// The file URL that `components` ("/" first, as Url::pathComponents gives them) name, or
// nothing when they don't form an absolute path.
std::optional<Url> urlFromPathComponents(const std::vector<std::string>& components);
// The ".Trash" folder beside the items of `url`'s library, or nothing.
std::optional<Url> trashFolderForURL(const Url& url);

// A document library: an app library, or the shared document storage, which plays the part of
// the library of the shared area. Put-back paths are relative to `root`.
struct DocumentLibrary {
    Url root;
    // For log lines: the app's bundle identifier, or the storage folder's path.
    std::string name;
};
// The library whose root contains `url`: the app libraries first (in root URL order), then
// the document storage. App libraries come first because one may lie inside the storage.
std::optional<DocumentLibrary> documentLibraryContaining(const Url& url);

// `url`'s path relative to `base` ("a/b.txt"), or nothing when `base` is not a strict
// ancestor of it.
std::optional<std::string> pathRelativeToBase(const Url& url, const Url& base);

// Where the trashed item at `url` goes back to: its put-back path resolved against the library
// that holds it. Nothing without a put-back attribute, outside every library, or when the path
// would lead out of the library.
std::optional<Url> resolvePutBackURL(const Url& url);
// Makes item records answer putBackURL() through resolvePutBackURL.
void installPutBackResolver();

}  // namespace tamber
