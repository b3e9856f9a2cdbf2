#include "fs/FolderDescendants.h"

#include <dirent.h>
#include <fcntl.h>

#include <vector>

#include "host/PublishedTrees.h"
#include "platform/FileSystem.h"

namespace tamber {

void forEachVisibleDescendant(const Url& folder, const std::function<bool(const Url&)>& visit) {
    FileSystem& fileSystem = FileSystem::current();
    // Depth first with an explicit stack, so a deep tree costs no native stack.
    std::vector<Url> pending{folder};
    while (!pending.empty()) {
        Url current = std::move(pending.back());
        pending.pop_back();
        auto opened = PublishedTrees::openFolder(current, O_RDONLY);
        if (!opened.ok())
            continue;
        std::vector<FileSystem::DirectoryEntry> entries;
        bool read = fileSystem.readDirectory(opened.value(), entries);
        fileSystem.close(opened.value());
        if (!read)
            continue;
        std::vector<Url> folders;
        for (const auto& entry : entries) {
            if (entry.name.empty() || entry.name[0] == '.')
                continue;
            Url url = current.appendingPathComponent(entry.name);
            if (visit(url) && (entry.type == DT_DIR || entry.type == DT_UNKNOWN))
                folders.push_back(std::move(url));
        }
        // Reversed onto the stack, so that folders are visited in name order.
        for (auto it = folders.rbegin(); it != folders.rend(); ++it) pending.push_back(*it);
    }
}

}  // namespace tamber
