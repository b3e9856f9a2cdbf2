#pragma once

#include <functional>
#include <optional>
#include <string>
#include <unordered_set>
#include <vector>

#include "platform/OpenFolder.h"
#include "platform/Url.h"
#include "support/Result.h"

namespace tamber {

// The one boundary of the program's file work: the published trees are the document storage
// folder and the app library roots, and nothing is read for an item, written or moved outside
// them. A URL is inside when its (lexically standardised) path is a root or lies below one, and
// no component between that root and the item is a symbolic link: folders below a root are
// opened beneath it without following any link, so a link inside a tree is an item of its
// own (renamed, moved, trashed, deleted as a link), never a way out. Every refusal is one error:
// HostPorterErrorDomain -1005 with the description kOutsideMessage.
class PublishedTrees {
public:
    static constexpr const char* kOutsideMessage =
        "not inside the document storage or an app library";

    using RootsSource = std::function<std::vector<Url>()>;
    // The app-library layer (above this one) installs where the library roots come from;
    // until it does, only the document storage is published. Returns the previous source.
    static RootsSource setAppLibraryRootsSource(RootsSource source);

    // The document storage folder, then the app library roots.
    static std::vector<Url> roots();
    // The deepest root that `url` is or lies below, by path alone; nothing outside.
    static std::optional<Url> rootOf(const Url& url);

    static Error outsideError(const Url& url);
    // Tells a refusal by a mark in its user info, not by its description.
    static bool isOutsideError(const Error& error);
    // `error` without that mark: for an error that wraps a refusal under a description of its
    // own, and so reports something else.
    static Error unmarked(Error error);

    // Nothing when `url` is inside: at or below a root, and the folder holding it reachable
    // from that root without a symbolic link. The item itself may be a link, or missing.
    // A URL made in a folder opened by openListedFolder is inside while that folder is open.
    static Status check(const Url& url);

    // Whether `url` is known to be inside without a look at the disk: made in a folder that a
    // listing opened beneath its root, or in a folder that the current scope of checked
    // folders found inside. Its folder was then a folder on the way from a root.
    static bool knownInside(const Url& url);

    // While one lives, check() on its thread opens each folder at most once: a folder found
    // inside answers for every file in it. For work that checks many files of a few folders
    // within moments (a page of a listing, a batch of events); a folder made a link meanwhile
    // could be missed for as long as the scope lasts, as it could between any check and its use.
    class CheckedFolders {
    public:
        CheckedFolders();
        ~CheckedFolders();
        CheckedFolders(const CheckedFolders&) = delete;
        CheckedFolders& operator=(const CheckedFolders&) = delete;

    private:
        friend class PublishedTrees;
        CheckedFolders* outer_;
        std::unordered_set<std::string> inside_;
    };

    // The folder `folder`, held open for reading its children (O_PATH): opened beneath its root
    // when it is inside (and then marked link-free), else as named. Nothing when it can't be
    // opened; reads then go by path.
    static OpenFolderRef openListedFolder(const std::string& folder);

    // Opens the folder `folder` (a root, or a folder below one reached without any link, the
    // folder itself included) with `flags` (O_DIRECTORY is added). The caller closes it.
    static Result<int> openFolder(const Url& folder, int flags);

    // The folder holding `url` (which must lie strictly below a root), opened beneath its
    // root, and the item's name in it. The item is then addressed relative to `fd` without
    // following it.
    struct Parent {
        int fd = -1;
        std::string name;
    };
    static Result<Parent> openParent(const Url& url, int flags);
};

}  // namespace tamber
