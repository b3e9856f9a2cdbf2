// Feeds arbitrary bytes to the reading of item identifiers and to the way an identifier becomes
// a file URL. The input is one length byte, that many bytes of identifier, and the path the
// journal answers for the identifier's file ID: the journal's memory may be stale or damaged,
// so it may name anything, relative to a small tree of published folders, links out of them,
// and folders beside them (or, when it starts with "/", anywhere). Checked:
// - an identifier that reads formats back to the same string, and is a container exactly when
//   the host's helper says so;
// - only a root, file or document identifier yields a URL, and every URL yielded is a root or
//   lies in a folder that really is inside a published tree (or would be, were it made): no
//   "..", link or look-alike sibling folder leads out; nor does the way to it pass through a
//   link, even one that leads back inside.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <system_error>
#include <vector>

#include "fuzz/support/FuzzSupport.h"
#include "host/HostPorterManager.h"
#include "host/ItemIdentifier.h"
#include "host/PublishedTrees.h"
#include "host/RecordingHostPorterManager.h"
#include "items/TBFileObjectIdentifier.h"
#include "items/TBPFileObjectIdentifier.h"
#include "platform/strata/StrataService.h"

using namespace tamber;

namespace {

// The journal as the input has it: every file ID names the one path of the input.
class InputJournal : public StrataService {
public:
    std::string answer;

    uint32_t getOrAllocateDocumentId(int) override {
        errno = ENOSYS;
        return 0;
    }
    uint32_t documentIdForInode(uint32_t, uint64_t) override { return 0; }
    uint64_t resolveDocumentId(uint32_t, uint32_t documentId) override {
        if (documentId == 0)
            errno = ENOENT;
        return documentId;
    }
    bool pathForFileId(uint32_t, uint64_t fileId, std::string& path) override {
        if (fileId == 0 || answer.empty()) {
            errno = ENOENT;
            return false;
        }
        path = answer;
        return true;
    }
};

struct Trees {
    std::string base;
    std::string storage;
    std::string library;
    std::shared_ptr<InputJournal> journal;
};

void makeFile(const std::string& path) {
    std::ofstream(path) << "x";
}

// base/storage (the document storage) and base/apps/app/Documents (an app library), with links
// out, a folder named like the storage, and files outside.
Trees& trees() {
    static Trees* made = [] {
        auto* t = new Trees;
        t->base = fuzz::scratchFolder("identifier");
        t->storage = t->base + "/storage";
        t->library = t->base + "/apps/app/Documents";
        namespace fs = std::filesystem;
        fs::create_directories(t->storage + "/docs/sub");
        fs::create_directories(t->library + "/inbox");
        fs::create_directories(t->base + "/outside");
        fs::create_directories(t->base + "/storage2");
        makeFile(t->storage + "/docs/a.txt");
        makeFile(t->library + "/notes.txt");
        makeFile(t->base + "/outside/secret");
        makeFile(t->base + "/storage2/x");
        fs::create_directory_symlink(t->base + "/outside", t->storage + "/out");
        fs::create_directory_symlink("..", t->storage + "/docs/up");
        fs::create_directory_symlink("../../../storage", t->library + "/storage");
        HostPorterManager::installDefaultManager(
            std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(t->storage)));
        std::string library = t->library;
        PublishedTrees::setAppLibraryRootsSource(
            [library] { return std::vector<Url>{Url::fileURLWithPath(library)}; });
        t->journal = std::make_shared<InputJournal>();
        StrataService::setCurrent(t->journal);
        return t;
    }();
    return *made;
}

bool atOrBelow(const std::string& path, const std::string& root) {
    return path == root || (path.size() > root.size() && path.compare(0, root.size(), root) == 0 &&
                            path[root.size()] == '/');
}

// Whether `path` is a root, or its folder, with every link and ".." resolved, is one of the
// roots or lies below one. A folder that does not exist counts as where its nearest existing
// folder is: nothing can be reached through it.
bool reallyInside(const std::string& path, const Trees& t) {
    if (path == t.storage || path == t.library)
        return true;
    // The URL's path is standardised: past the nearest folder that exists, nothing can climb.
    std::filesystem::path folder = std::filesystem::path(path).parent_path();
    std::error_code error;
    while (folder.has_relative_path() && !std::filesystem::exists(folder, error))
        folder = folder.parent_path();
    auto resolved = std::filesystem::canonical(folder, error);
    if (error)
        return false;
    return atOrBelow(resolved.string(), t.storage) || atOrBelow(resolved.string(), t.library);
}

// Whether `path` lies lexically below `root` with no symbolic link among the folders between
// them: the published trees are walked beneath their roots without following any link.
bool linkFreeBelow(const std::string& path, const std::string& root) {
    if (!atOrBelow(path, root))
        return false;
    for (std::string folder = std::filesystem::path(path).parent_path().string();
         folder.size() > root.size();
         folder = std::filesystem::path(folder).parent_path().string()) {
        struct stat status;
        if (::lstat(folder.c_str(), &status) == 0 && S_ISLNK(status.st_mode))
            return false;
    }
    return true;
}

void checkReading(const std::string& identifier) {
    ItemIdentifier parsed = ItemIdentifier::parse(identifier);
    if (parsed.isContainer() != isHostContainerIdentifier(identifier))
        std::abort();
    switch (parsed.kind()) {
        case ItemIdentifier::Kind::File:
            if (TBPFileObjectIdentifier::fromFileID(parsed.number()) != identifier)
                std::abort();
            break;
        case ItemIdentifier::Kind::Document:
            if (TBPFileObjectIdentifier::fromDocumentID(parsed.number()) != identifier)
                std::abort();
            break;
        case ItemIdentifier::Kind::AppLibrary:
            if ("#" + parsed.bundleIdentifier() != identifier)
                std::abort();
            break;
        case ItemIdentifier::Kind::Invalid:
            if (parsed.number() != 0 || !parsed.bundleIdentifier().empty())
                std::abort();
            break;
        default:
            break;
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static bool quiet = [] {
        fuzz::silenceLog();
        return true;
    }();
    (void)quiet;
    Trees& t = trees();
    fuzz::InputReader in(data, size);
    std::string identifier = in.take(in.byte());
    std::string remembered = in.rest();
    checkReading(identifier);

    t.journal->answer =
        remembered.empty() || remembered.front() == '/' ? remembered : t.base + "/" + remembered;
    auto url = TBFileObjectIdentifier::fileURLWithItemIdentifier(identifier);
    if (!url)
        return 0;
    ItemIdentifier parsed = ItemIdentifier::parse(identifier);
    const bool named = parsed.kind() == ItemIdentifier::Kind::RootContainer ||
                       parsed.kind() == ItemIdentifier::Kind::File ||
                       parsed.kind() == ItemIdentifier::Kind::Document;
    if (!named || !url->isFileURL() || !reallyInside(url->path(), t) ||
        !(linkFreeBelow(url->path(), t.storage) || linkFreeBelow(url->path(), t.library)))
        std::abort();
    return 0;
}
