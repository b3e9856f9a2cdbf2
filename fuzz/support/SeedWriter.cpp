// Writes the fuzz targets' seed corpora with the program's own writers, so that every seed is
// an input the program really meets: `fuzz_seed_writer fuzz/seeds` (files are replaced, none
// removed). Desktop entries and damaged journal rows have no writer of ours: those seeds are
// written out here as the programs and faults that make them would.
#include <sys/xattr.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "applibraries/LocalAppLibraryCache.h"
#include "fs/FSChangeToken.h"
#include "fuzz/support/FuzzSupport.h"
#include "host/HostPorterManager.h"
#include "host/HostPorterPage.h"
#include "host/RecordingHostPorterManager.h"
#include "items/ItemMetadata.h"
#include "items/LocalItem.h"
#include "items/TBPFileObjectIdentifier.h"
#include "items/XdgTagList.h"
#include "platform/FileContents.h"
#include "platform/apps/AppRecord.h"
#include "platform/objects/Date.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "platform/strata/StrataService.h"
#include "platform/tremors/JournalWriter.h"

using namespace tamber;

namespace {

std::string out;

void write(const std::string& corpus, const std::string& name, const std::string& bytes) {
    std::filesystem::create_directories(out + "/" + corpus);
    std::ofstream(out + "/" + corpus + "/" + name, std::ios::binary | std::ios::trunc) << bytes;
}

void write(const std::string& corpus, const std::string& name, const Bytes& bytes) {
    write(corpus, name, std::string(bytes.begin(), bytes.end()));
}

void changeTokens() {
    const std::string uuid = "9B2E61C4-0F3A-4D7E-A1B8-5C6D7E8F9012";
    // What currentSyncAnchor hands out: the journal's event ID, the app libraries' version.
    write("change_token", "sync_anchor", FSChangeToken{0, uuid, 123456, 0, 3}.encode());
    write("change_token", "sync_anchor_no_apps", FSChangeToken{0, uuid, 1, 0, 0}.encode());
    // What the gather phase hands out after its second page.
    write("change_token", "page_token", FSChangeToken{0, uuid, 40, 400, 0}.encode());
    write("change_token", "initial_page_by_date", HostPorterInitialPageSortedByDate());
    write("change_token", "initial_page_by_name", HostPorterInitialPageSortedByName());
}

void docIDPaths() {
    write("docid_path", "safe_save", JournalWriter::documentIdPath(2049, 42, 131074, 131080));
    write("docid_path", "deleted", JournalWriter::documentIdPath(2049, 7, 524301, 0));
    write("docid_path", "high_inode",
          JournalWriter::documentIdPath(64769, 4294967295u, (1ull << 63) + 5, 12));
    write("docid_path", "short_form", std::string(".docid/changed/3/src=1,dst=2"));
}

void identifiers() {
    auto seed = [](const std::string& name, const std::string& identifier,
                   const std::string& remembered) {
        write("item_identifier", name,
              std::string(1, char(identifier.size())) + identifier + remembered);
    };
    seed("file", TBPFileObjectIdentifier::fromFileID(12), "storage/docs/a.txt");
    seed("document", TBPFileObjectIdentifier::fromDocumentID(3), "apps/app/Documents/notes.txt");
    seed("folder", TBPFileObjectIdentifier::fromFileID(13), "storage/docs/sub");
    seed("through_link_out", TBPFileObjectIdentifier::fromFileID(9), "storage/out/secret");
    seed("through_link_up", TBPFileObjectIdentifier::fromFileID(9), "storage/docs/up/docs/a.txt");
    seed("dot_dot", TBPFileObjectIdentifier::fromDocumentID(4), "storage/../outside/secret");
    seed("sibling", TBPFileObjectIdentifier::fromFileID(5), "storage2/x");
    seed("library_link", TBPFileObjectIdentifier::fromFileID(6),
         "apps/app/Documents/storage/docs/a.txt");
    seed("absolute", TBPFileObjectIdentifier::fromFileID(UINT64_MAX), "/etc/passwd");
    seed("root", HostPorterRootContainerItemIdentifier, "");
    seed("working_set", HostPorterWorkingSetContainerItemIdentifier, "storage/docs");
    seed("library", "#org.example.app", "apps/app/Documents");
    seed("trailing_text", "fid=1x", "storage/docs/a.txt");
    seed("large_document", "did=4294967296", "storage/docs/a.txt");
}

void appLibraryCaches(const std::string& scratch) {
    ::setenv("XDG_DATA_HOME", (scratch + "/data").c_str(), 1);
    LocalAppLibraryCache::resetSharedForTesting();
    auto notes = BundleRecord::make({"org.example.Notes", "Notes",
                                     Url::fileURLWithPath("/home/u/.var/app/org.example.Notes"),
                                     "org.example.Notes"});
    auto editor = AppRecord::make(
        {"org.example.Editor", "Editor", Url::fileURLWithPath("/home/u/Editor"), std::nullopt},
        {true, true, Dictionary::make({{"HostSupportsDocumentBrowser", Number::fromBool(true)}})});
    auto bare = BundleRecord::make({"org.example.Bare", std::nullopt, std::nullopt, std::nullopt});
    auto save = [&](LocalAppLibraryCacheSource source, const std::string& name,
                    const std::vector<BundleRecordRef>& records, uint64_t token) {
        auto cache = LocalAppLibraryCache::forSource(source);
        cache->queue().sync([&] {
            if (!cache->save(records, token, false).ok())
                std::abort();
        });
        auto bytes = FileContents::read(cache->cacheURL());
        if (!bytes.ok())
            std::abort();
        std::string seed(1, source == LocalAppLibraryCacheSource::main ? '\0' : '\1');
        write("app_library_cache", name, seed + std::string(bytes->begin(), bytes->end()));
    };
    save(LocalAppLibraryCacheSource::main, "main_three", {notes, editor, bare}, 7);
    save(LocalAppLibraryCacheSource::main, "main_empty", {}, 1);
    save(LocalAppLibraryCacheSource::workingSet, "working_set_one", {notes}, 18446744073709551615u);
}

void desktopEntries() {
    write("desktop_entry", "application",
          std::string("[Desktop Entry]\nType=Application\nName=Notes\nName[de]=Notizen\n"
                      "Exec=notes %f\nIcon=org.example.Notes\nMimeType=text/plain;\n"
                      "X-Tamber-Supports-Open-In-Place=true\nX-Tamber-File-Sharing-Enabled=true\n"
                      "X-Tamber-Supports-Document-Browser=false\n"
                      "X-Tamber-Data-Container=~/Documents/Notes\n"));
    write("desktop_entry", "flatpak",
          std::string("[Desktop Entry]\nType=Application\nName=Editor\nExec=editor\n"
                      "X-Flatpak=org.example.Editor\n\n[Desktop Action new]\nName=New\n"
                      "Exec=editor --new\n"));
    write("desktop_entry", "link",
          std::string("# a comment\n[Desktop Entry]\nType=Link\nName=Site\n"
                      "URL=https://example.org/\nX-Tamber-Data-Container=/srv/site\n"));
    write("desktop_entry", "hidden",
          std::string("[Desktop Entry]\nType=Application\nName=Gone\nExec=gone\nHidden=true\n"));
    write("desktop_entry", "missing_program",
          std::string("[Desktop Entry]\nType=Application\nName=Absent\nExec=absent\n"
                      "TryExec=/nonexistent/absent\n"));
    write("desktop_entry", "relative_container",
          std::string("[Desktop Entry]\nType=Application\nName=Rel\nExec=rel\n"
                      "X-Tamber-Data-Container=relative/path\nIcon=/usr/share/icons/rel.png\n"));
}

// Every file is one document; the writers need the service only to tell it of their writes.
class OneDocument : public StrataService {
public:
    uint32_t getOrAllocateDocumentId(int) override { return 1; }
    uint32_t documentIdForInode(uint32_t, uint64_t) override { return 1; }
    uint64_t resolveDocumentId(uint32_t, uint32_t) override {
        errno = ENOENT;
        return 0;
    }
    bool pathForFileId(uint32_t, uint64_t, std::string&) override {
        errno = ENOENT;
        return false;
    }
};

// The attributes the writers leave on a file, as (index, length, value) records in the order
// the fuzz target numbers them.
std::string attributeRecords(const std::string& path) {
    const std::vector<std::string> names = {
        LocalItem::xattrLastUsedDateName(), LocalItem::xattrTagDataName(),
        LocalItem::xattrFavoriteRankName(), LocalItem::xattrTrashDateName(),
        LocalItem::xattrTrashPutBackName(), XdgTagList::attributeName(),
        XdgTagList::syncedAttributeName(),
    };
    std::string records;
    for (size_t i = 0; i < names.size(); ++i) {
        char buffer[65536];
        ssize_t n = ::getxattr(path.c_str(), ("user." + names[i]).c_str(), buffer, sizeof buffer);
        if (n >= 0)
            records += char(i) + fuzz::encodePiece(std::string_view(buffer, size_t(n)));
    }
    return records;
}

void itemMetadata(const std::string& scratch) {
    std::string storage = scratch + "/storage";
    std::filesystem::create_directories(storage);
    HostPorterManager::installDefaultManager(
        std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(storage)));
    StrataService::setCurrent(std::make_shared<OneDocument>());
    int n = 0;
    auto item = [&] {
        std::string path = storage + "/item" + std::to_string(n++);
        std::ofstream(path) << "x";
        return path;
    };
    {
        std::string path = item();
        Url url = Url::fileURLWithPath(path);
        ItemMetadata::writeLastUsedDate(url, Date::make(786000000.25));
        ItemMetadata::writeTagData(url, ItemMetadata::tagDataForLabels({"Red", "Work", "ünï"}));
        ItemMetadata::writeFavoriteRank(url, Number::fromInt64(3));
        write("item_metadata", "used_tagged_ranked", attributeRecords(path));
    }
    {
        std::string path = item();
        Url url = Url::fileURLWithPath(path);
        ItemMetadata::writeTrashDate(url, Date::make(-1.5));
        ItemMetadata::writePutBack(url, String::make("Projects/2024/report.txt"));
        write("item_metadata", "trashed", attributeRecords(path));
    }
    {
        // Attributes travel with a file: this one was trashed somewhere else entirely.
        std::string path = item();
        Url url = Url::fileURLWithPath(path);
        ItemMetadata::writeTrashDate(url, Date::make(1.0e9));
        ItemMetadata::writePutBack(url, String::make("a/../../../etc/passwd"));
        write("item_metadata", "put_back_climbing", attributeRecords(path));
    }
    {
        // The desktop's list changed by another program after Tamber wrote its tags.
        std::string path = item();
        Url url = Url::fileURLWithPath(path);
        ItemMetadata::writeTagData(url, ItemMetadata::tagDataForLabels({"One", "Two"}));
        std::string list = "Two,Three, Four ,One";
        ::setxattr(path.c_str(), ("user." + XdgTagList::attributeName()).c_str(), list.data(),
                   list.size(), 0);
        write("item_metadata", "desktop_list_changed", attributeRecords(path));
    }
    {
        std::string path = item();
        std::string list = "alpha,beta";
        ::setxattr(path.c_str(), ("user." + XdgTagList::attributeName()).c_str(), list.data(),
                   list.size(), 0);
        write("item_metadata", "desktop_list_only", attributeRecords(path));
    }
    {
        std::string path = item();
        ItemMetadata::writeTagData(Url::fileURLWithPath(path), Bytes{});
        write("item_metadata", "tags_cleared", attributeRecords(path));
    }
}

// Statement records for the journal-rows target: a statement index, then per parameter a type
// (0 NULL, 1 integer, 2 real, 3 text, 4 blob) and its value; sixteen lookup bytes end it.
struct Rows {
    std::string bytes;
    Rows& statement(int index) {
        bytes += char(index);
        return *this;
    }
    Rows& null() {
        bytes += char(0);
        return *this;
    }
    Rows& integer(int64_t value) {
        bytes += char(1) + fuzz::encodeU64(uint64_t(value));
        return *this;
    }
    Rows& text(const std::string& value) {
        bytes += char(3) + fuzz::encodePiece(value);
        return *this;
    }
    Rows& blob(const std::string& value) {
        bytes += char(4) + fuzz::encodePiece(value);
        return *this;
    }
    std::string end(uint64_t inode, uint64_t mixed) {
        return bytes + fuzz::encodeU64(inode) + fuzz::encodeU64(mixed);
    }
};

void journalRows() {
    write("tremor_rows", "untouched", Rows().end(102, 3));
    write("tremor_rows", "event_paths",
          Rows()
              .statement(0)
              .integer(13)
              .integer(1)
              .text("/w/../../etc/passwd")
              .integer(5)
              .integer(0x100)
              .statement(0)
              .integer(14)
              .integer(99)
              .text("relative")
              .integer(-1)
              .integer(-1)
              .statement(0)
              .integer(-5)
              .integer(1)
              .text("")
              .integer(0)
              .integer(0)
              .end(102, 1));
    write(
        "tremor_rows", "counters",
        Rows().statement(1).integer(INT64_MAX).integer(INT64_MIN).end(101, 0xffffffffffffffffull));
    write("tremor_rows", "wrong_types",
          Rows()
              .statement(0)
              .integer(15)
              .text("one")
              .blob("/w/f")
              .text("x")
              .blob("y")
              .statement(5)
              .integer(3)
              .text("103")
              .statement(2)
              .integer(-7)
              .blob("\x01\x02")
              .end(103, 7));
    write("tremor_rows", "tree_names",
          Rows()
              .statement(8)
              .integer(100)
              .text("..")
              .integer(101)
              .statement(4)
              .integer(104)
              .integer(101)
              .text("a/b")
              .integer(1)
              .null()
              .null()
              .null()
              .null()
              .statement(4)
              .integer(105)
              .integer(105)
              .text("loop")
              .integer(2)
              .null()
              .null()
              .null()
              .null()
              .end(104, 2));
    write("tremor_rows", "roots",
          Rows()
              .statement(9)
              .text("")
              .integer(-1)
              .integer(1)
              .statement(3)
              .integer(7)
              .text("/w/a")
              .integer(INT64_MAX)
              .integer(101)
              .integer(1)
              .end(102, 5));
    write("tremor_rows", "documents",
          Rows()
              .statement(5)
              .integer(4294967296ll)
              .integer(101)
              .statement(5)
              .integer(-1)
              .integer(-1)
              .statement(6)
              .integer(1)
              .text("user.x")
              .null()
              .end(101, 4294967296ull));
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::cerr << "usage: fuzz_seed_writer SEEDS_FOLDER\n";
        return 2;
    }
    fuzz::silenceLog();
    out = argv[1];
    const std::string& scratch = fuzz::scratchFolder("seeds");
    changeTokens();
    docIDPaths();
    identifiers();
    appLibraryCaches(scratch);
    desktopEntries();
    itemMetadata(scratch);
    journalRows();
    return 0;
}
