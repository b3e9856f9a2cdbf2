#include "host/PublishedTrees.h"

#include <fcntl.h>

#include <cerrno>
#include <memory>
#include <mutex>

#include "host/HostPorterManager.h"
#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "support/Error.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

// The innermost scope of checked folders of this thread, or null.
thread_local PublishedTrees::CheckedFolders* tCheckedFolders = nullptr;

// Whether `path` names an entry directly inside the folder `folder`.
bool isChildPath(const std::string& folder, const std::string& path) {
    std::string_view prefix(folder);
    if (prefix.ends_with('/'))
        prefix.remove_suffix(1);
    return path.size() > prefix.size() + 1 && path.starts_with(prefix) &&
           path[prefix.size()] == '/' && path.find('/', prefix.size() + 1) == std::string::npos;
}

std::mutex& sourceMutex() {
    static ProcessWide<std::mutex> mutex;
    return *mutex;
}

PublishedTrees::RootsSource& rootsSource() {
    static ProcessWide<PublishedTrees::RootsSource> source;
    return *source;
}

bool isAtOrBelow(const std::string& root, const std::string& path) {
    if (path.size() < root.size() || path.compare(0, root.size(), root) != 0)
        return false;
    return path.size() == root.size() || root == "/" || path[root.size()] == '/';
}

// `path` relative to `root` ("" for the root itself); `path` is at or below `root`.
std::string relativeTo(const std::string& root, const std::string& path) {
    if (path.size() == root.size())
        return {};
    return path.substr(root == "/" ? 1 : root.size() + 1);
}

// A link or an escape on the way down is the boundary's refusal; anything else is what the
// system said.
Error openFailure(const Url& url, int error) {
    if (error == ELOOP || error == EXDEV)
        return PublishedTrees::outsideError(url);
    return Error::posix(error);
}

}  // namespace

PublishedTrees::RootsSource PublishedTrees::setAppLibraryRootsSource(RootsSource source) {
    std::lock_guard lock(sourceMutex());
    std::swap(rootsSource(), source);
    return source;
}

std::vector<Url> PublishedTrees::roots() {
    std::vector<Url> all{HostPorterManager::defaultManager()->documentStorageURL()};
    RootsSource source;
    {
        std::lock_guard lock(sourceMutex());
        source = rootsSource();
    }
    if (source) {
        for (Url& root : source()) {
            if (root.isFileURL())
                all.push_back(std::move(root));
        }
    }
    return all;
}

std::optional<Url> PublishedTrees::rootOf(const Url& url) {
    if (!url.isFileURL())
        return std::nullopt;
    std::optional<Url> deepest;
    for (Url& root : roots()) {
        if (root.path().empty() || !isAtOrBelow(root.path(), url.path()))
            continue;
        if (!deepest || root.path().size() > deepest->path().size())
            deepest = std::move(root);
    }
    return deepest;
}

// Marks the boundary's refusals, so that they are told apart by a key rather than by their
// text. An error that wraps one under a description of its own drops the mark: it reports
// something else.
constexpr const char* kOutsideKey = "outsidePublishedTrees";

Error PublishedTrees::outsideError(const Url& url) {
    return Error(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                 {{"description", kOutsideMessage}, {"path", url.path()}, {kOutsideKey, "1"}});
}

bool PublishedTrees::isOutsideError(const Error& error) {
    return error.is(kHostPorterErrorDomain, kHostPorterNoSuchItem) &&
           error.userInfo().contains(kOutsideKey);
}

Error PublishedTrees::unmarked(Error error) {
    std::map<std::string, std::string> info = error.userInfo();
    info.erase(kOutsideKey);
    return Error(error.domain(), error.code(), std::move(info));
}

Result<int> PublishedTrees::openFolder(const Url& folder, int flags) {
    auto root = rootOf(folder);
    if (!root)
        return outsideError(folder);
    FileSystem& fs = FileSystem::current();
    // The root is published as named, through a link if it is one.
    ScopedFd rootFd(fs.open(root->path(), O_PATH | O_DIRECTORY));
    if (!rootFd.ok())
        return Error::posix(errno);
    std::string relative = relativeTo(root->path(), folder.path());
    int fd = relative.empty() ? fs.open(root->path(), flags | O_DIRECTORY)
                              : fs.openBeneath(rootFd.get(), relative, flags | O_DIRECTORY);
    if (fd < 0)
        return openFailure(folder, errno);
    return fd;
}

OpenFolderRef PublishedTrees::openListedFolder(const std::string& folder) {
    constexpr int kFlags = O_PATH | O_CLOEXEC;
    Url url = Url::fileURLWithPath(folder);
    // Without a host there are no published trees, only a folder to walk.
    if (HostPorterManager::installedManager() && rootOf(url)) {
        auto fd = openFolder(url, kFlags);
        if (!fd.ok())
            return nullptr;
        return std::make_shared<const OpenFolder>(url.path(), ScopedFd(fd.value()), true);
    }
    ScopedFd fd(FileSystem::current().open(url.path(), kFlags | O_DIRECTORY));
    if (!fd.ok())
        return nullptr;
    return std::make_shared<const OpenFolder>(url.path(), std::move(fd), false);
}

Result<PublishedTrees::Parent> PublishedTrees::openParent(const Url& url, int flags) {
    auto root = rootOf(url);
    if (!root)
        return outsideError(url);
    if (root->path() == url.path())
        return Error::invalidParameter("url", url.path());
    auto fd = openFolder(url.deletingLastPathComponent(), flags);
    if (!fd.ok())
        return isOutsideError(fd.error()) ? outsideError(url) : fd.error();
    return Parent{fd.value(), url.lastPathComponent()};
}

Status PublishedTrees::check(const Url& url) {
    auto root = rootOf(url);
    if (!root)
        return outsideError(url);
    if (root->path() == url.path())
        return Status::OK();
    if (knownInside(url))
        return Status::OK();
    auto parent = openParent(url, O_PATH);
    if (!parent.ok()) {
        // A missing folder on the way leaves nothing to escape through; only refusals count.
        if (isOutsideError(parent.error()))
            return parent.error();
        return Status::OK();
    }
    ScopedFd opened(parent.value().fd);  // only its opening mattered
    if (CheckedFolders* checked = tCheckedFolders) {
        const std::string& path = url.path();
        checked->inside_.emplace(path, 0, path.rfind('/'));
    }
    return Status::OK();
}

bool PublishedTrees::knownInside(const Url& url) {
    // A listing that opened the folder beneath its root has checked it already.
    if (OpenFolderRef folder = url.openFolder();
        folder && folder->linkFree() && isChildPath(folder->path(), url.path()))
        return true;
    CheckedFolders* checked = tCheckedFolders;
    if (!checked || checked->inside_.empty())
        return false;
    const std::string& path = url.path();
    size_t slash = path.rfind('/');
    return slash != std::string::npos && checked->inside_.contains(path.substr(0, slash));
}

PublishedTrees::CheckedFolders::CheckedFolders() : outer_(tCheckedFolders) {
    tCheckedFolders = this;
}

PublishedTrees::CheckedFolders::~CheckedFolders() {
    tCheckedFolders = outer_;
}

}  // namespace tamber
