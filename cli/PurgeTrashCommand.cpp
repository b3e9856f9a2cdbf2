#include "cli/PurgeTrashCommand.h"

#include <fcntl.h>

#include <algorithm>
#include <charconv>
#include <ostream>
#include <vector>

#include "applibraries/LocalAppLibraryManager.h"
#include "cli/ItemAction.h"
#include "cli/JsonValues.h"
#include "items/LocalAppLibraryItem.h"
#include "platform/FileSystem.h"
#include "platform/objects/Date.h"
#include "provider/TrashLocations.h"

namespace tamber {

namespace {

// The folders the sweep looks at: each library's trash and the storage's.
std::vector<Url> trashFolders(const Url& storage) {
    std::vector<Url> folders;
    auto add = [&](const Url& folder) {
        if (std::find(folders.begin(), folders.end(), folder) == folders.end())
            folders.push_back(folder);
    };
    for (const auto& library : LocalAppLibraryManager::shared()->allItems()) {
        if (auto trash = trashFolderForURL(library->fileURL()))
            add(*trash);
    }
    add(storage.appendingPathComponent(".Trash"));
    return folders;
}

// Trashed items are the visible entries at the top of the trash folders; a folder that is
// missing or unreadable holds none.
size_t countTrashedItems(const std::vector<Url>& folders) {
    FileSystem& fs = FileSystem::current();
    size_t count = 0;
    for (const auto& folder : folders) {
        int fd = fs.open(folder.path(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        if (fd < 0)
            continue;
        std::vector<FileSystem::DirectoryEntry> entries;
        if (fs.readDirectory(fd, entries))
            count += std::count_if(entries.begin(), entries.end(),
                                   [](const auto& entry) { return entry.name.front() != '.'; });
        fs.close(fd);
    }
    return count;
}

}  // namespace

std::optional<double> PurgeTrashCommand::parseDuration(const std::string& text) {
    if (text.size() < 2)
        return std::nullopt;
    double unit = 0;
    switch (text.back()) {
        case 's':
            unit = 1;
            break;
        case 'm':
            unit = 60;
            break;
        case 'h':
            unit = 3600;
            break;
        case 'd':
            unit = 86400;
            break;
        default:
            return std::nullopt;
    }
    uint64_t amount = 0;
    const char* end = text.data() + text.size() - 1;
    auto [stop, ec] = std::from_chars(text.data(), end, amount);
    if (ec != std::errc() || stop != end)
        return std::nullopt;
    return static_cast<double>(amount) * unit;
}

CLI::App* PurgeTrashCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand(
        "purge-trash", "Delete for good what has been in the trash longer than a duration");
    sub->add_option("--older-than", olderThan_,
                    "How long an item must have been trashed: N followed by s, m, h or d "
                    "(30d, 12h, 90m, 45s)")
        ->required();
    sub->add_flag("--json", json_, "Print {\"removed\": N}");
    return sub;
}

int PurgeTrashCommand::run(CliContext& context) {
    auto seconds = parseDuration(olderThan_);
    if (!seconds)
        return context.fail(CliContext::usageError("--older-than takes a duration such as 30d, "
                                                   "12h, 90m or 45s, not \"" +
                                                   olderThan_ + "\""),
                            json_);
    auto porter = context.prepareProvider();
    if (!porter.ok())
        return context.fail(porter.error(), json_);
    auto folders = trashFolders(context.storageURL());
    size_t before = countTrashedItems(folders);
    auto reference = Date::make(Date::now()->timeIntervalSince1970() - *seconds);
    ItemAction::waitFor([&](std::function<void()> done) {
        porter.value()->_removeTrashedItemsOlderThanDate(reference, std::move(done));
    });
    size_t after = countTrashedItems(folders);
    size_t removed = before > after ? before - after : 0;
    if (json_)
        context.out() << jsonText(nlohmann::json{{"removed", removed}}) << "\n";
    else
        context.out() << "removed " << removed << (removed == 1 ? " item" : " items") << "\n";
    return 0;
}

}  // namespace tamber
