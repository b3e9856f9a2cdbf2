#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <limits>

#include "applibraries/LocalAppLibraryManager.h"
#include "enumeration/FSDirectoryEnumerator.h"
#include "host/HostPorterManager.h"
#include "host/PublishedTrees.h"
#include "items/ExtendedAttributes.h"
#include "items/ItemMetadata.h"
#include "items/LocalAppLibraryItem.h"
#include "items/UnarchiveLogged.h"
#include "platform/FileSystem.h"
#include "provider/LocalPorter.h"
#include "provider/TrashLocations.h"
#include "support/DispatchGroup.h"
#include "support/Log.h"
#include "support/LogSection.h"

namespace tamber {

namespace {

// Every trash folder, each once: the app libraries' (in the manager's order), then the shared
// area's. Two libraries may share a trash folder when one lies inside the other.
std::vector<Url> trashFoldersToSweep(const ProviderServices& services) {
    std::vector<Url> folders;
    auto add = [&](const Url& folder) {
        if (std::find(folders.begin(), folders.end(), folder) != folders.end())
            return;
        // Only a real folder reached without links: a linked .Trash is not read at all.
        auto opened = PublishedTrees::openFolder(folder, O_PATH);
        if (!opened.ok())
            return;
        services.fileSystem->close(opened.value());
        folders.push_back(folder);
    };
    for (const auto& library : LocalAppLibraryManager::shared()->allItems()) {
        if (auto trash = trashFolderForURL(library->fileURL()))
            add(*trash);
    }
    add(services.manager->documentStorageURL().appendingPathComponent(".Trash"));
    return folders;
}

// Items whose date is gone or unreadable age from now on instead of never.
void restamp(const Url& url) {
    (void)ItemMetadata::writeTrashDate(url, Date::now());
}

// A symbolic link can carry no attributes, so it has no trash date: it ages from its last
// status change, which moving it into the trash made. Nothing for anything else.
std::shared_ptr<const Date> linkTrashDate(FileSystem& fileSystem, const Url& url) {
    struct statx st {};
    if (fileSystem.statx(AT_FDCWD, url.path(), AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_CTIME,
                         &st) != 0 ||
        !S_ISLNK(st.stx_mode))
        return nullptr;
    return Date::make(double(st.stx_ctime.tv_sec) + st.stx_ctime.tv_nsec / 1e9);
}

}  // namespace

void LocalPorter::_removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                                   std::function<void()> completion) {
    sweepTrash(std::move(referenceDate), [completion = std::move(completion)](size_t) {
        if (completion)
            completion();
    });
}

void LocalPorter::removeTrashedItemsOlderThanDate(std::shared_ptr<const Date> referenceDate,
                                                  std::function<void(size_t removed)> completion) {
    sweepTrash(std::move(referenceDate), std::move(completion));
}

void LocalPorter::sweepTrash(std::shared_ptr<const Date> referenceDate,
                             std::function<void(size_t removed)> completion) {
    std::string title = "remove trashed items older than " +
                        (referenceDate ? referenceDate->description() : std::string("nil"));
    withLogSection(title, [&] {
        auto group = std::make_shared<DispatchGroup>();
        // Deletions finish on their own threads; the group's notification reads the count
        // after the last of them.
        auto removed = std::make_shared<std::atomic<size_t>>(0);

        FSDirectoryEnumerator walk;
        walk.urls = trashFoldersToSweep(services_);
        walk.limit = std::numeric_limits<uint64_t>::max();  // a limit of 0 delivers nothing
        // Only the top level: what lies inside a trashed folder goes with the folder.
        walk.directoryEnumerationOptionsFor =
            [](const Url&) -> std::optional<DirectoryEnumerationOptions> {
            return DirectoryEnumerationOption::kSkipsHiddenFiles |
                   DirectoryEnumerationOption::kSkipsPackageDescendants |
                   DirectoryEnumerationOption::kSkipsSubdirectoryDescendants;
        };
        walk.enumerate([&](const Url& url) {
            std::shared_ptr<const Date> trashDate = linkTrashDate(*services_.fileSystem, url);
            auto data =
                trashDate ? std::nullopt : ReadXattrData(LocalItem::xattrTrashDateName(), url);
            if (!trashDate && !data) {
                logDebug([&] {
                    return "can't find trash date for URL \"" + url.path() + "\"; set current date";
                });
                return restamp(url);
            }
            if (!trashDate)
                trashDate = UnarchiveLogged<Date>(*data);
            if (!trashDate) {
                logError("can't unarchive xattr data for URL \"" + url.path() +
                         "\"; set current date");
                return restamp(url);
            }
            if (!referenceDate ||
                !(trashDate->timeIntervalSince1970() < referenceDate->timeIntervalSince1970()))
                return;
            auto identifier = identifierForURLLogged(url);
            if (!identifier) {
                logError("identifier lookup failed for URL \"" + url.path() + "\"");
                return;
            }
            logDebug([&] {
                return "item " + *identifier +
                       " was trashed before reference date, let's remove it";
            });
            group->enter();
            deleteItemWithIdentifier(*identifier, [group, removed](Status status) {
                if (status.ok())
                    ++*removed;
                group->leave();
            });
        });

        logDebug("wait until all deletions are complete");
        group->notify(DispatchQueue::makeSerial("tamber.auto-delete.notifier"),
                      [removed, completion = std::move(completion)] {
                          if (completion)
                              completion(removed->load());
                      });
    });
}

}  // namespace tamber
