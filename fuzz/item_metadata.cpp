// Feeds arbitrary bytes as the extended attributes of one published file: the five metadata
// attributes, the desktop's tag list and Tamber's note of it. The input is a run of
// (attribute index byte, 16-bit little-endian length, value). Checked:
// - the file's record is built whatever its attributes hold (bad metadata hides nothing), and
//   carries the metadata as read;
// - reading is settled after one read: a second read gives the same metadata (taking in the
//   desktop's list happens once);
// - what was read, written back through the one writer, reads back equal;
// - the tag labels are the labels of the tag data;
// - the record's put-back location, read from the attribute whatever it holds, is one only
//   with a put-back attribute, and always strictly inside the library that holds the file.
#include <sys/xattr.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "fuzz/support/FuzzSupport.h"
#include "host/HostPorterManager.h"
#include "host/RecordingHostPorterManager.h"
#include "items/ItemMetadata.h"
#include "items/LocalItem.h"
#include "items/XdgTagList.h"
#include "platform/Tag.h"
#include "platform/strata/StrataService.h"
#include "provider/TrashLocations.h"

using namespace tamber;

namespace {

using fuzz::check;

// Every file is document 7; nothing resolves back.
class OneDocument : public StrataService {
public:
    uint32_t getOrAllocateDocumentId(int) override { return 7; }
    uint32_t documentIdForInode(uint32_t, uint64_t) override { return 7; }
    uint64_t resolveDocumentId(uint32_t, uint32_t) override {
        errno = ENOENT;
        return 0;
    }
    bool pathForFileId(uint32_t, uint64_t, std::string&) override {
        errno = ENOENT;
        return false;
    }
};

const std::vector<std::string>& attributeNames() {
    static const std::vector<std::string> names = {
        LocalItem::xattrLastUsedDateName(), LocalItem::xattrTagDataName(),
        LocalItem::xattrFavoriteRankName(), LocalItem::xattrTrashDateName(),
        LocalItem::xattrTrashPutBackName(), XdgTagList::attributeName(),
        XdgTagList::syncedAttributeName(),
    };
    return names;
}

const std::string& itemPath() {
    static const std::string path = [] {
        fuzz::silenceLog();
        // The app libraries (none) are read from a cache of the scratch folder's.
        ::setenv("XDG_DATA_HOME", (fuzz::scratchFolder("metadata") + "/data").c_str(), 1);
        installPutBackResolver();
        std::string storage = fuzz::scratchFolder(nullptr) + "/storage";
        std::filesystem::create_directories(storage);
        std::string file = storage + "/item.txt";
        std::ofstream(file) << "contents";
        HostPorterManager::installDefaultManager(
            std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(storage)));
        StrataService::setCurrent(std::make_shared<OneDocument>());
        return file;
    }();
    return path;
}

template <class T>
bool same(const std::shared_ptr<const T>& a, const std::shared_ptr<const T>& b) {
    return (!a && !b) || (a && b && a->isEqual(*b));
}

bool same(const ItemMetadata& a, const ItemMetadata& b) {
    return same(a.lastUsedDate, b.lastUsedDate) && a.tagLabels == b.tagLabels &&
           a.tagData == b.tagData && same(a.favoriteRank, b.favoriteRank) &&
           same(a.trashDate, b.trashDate) && same(a.putBack, b.putBack);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string& path = itemPath();
    for (const auto& name : attributeNames()) ::removexattr(path.c_str(), ("user." + name).c_str());
    fuzz::InputReader in(data, size);
    while (in.remaining() > 0) {
        const std::string& name = attributeNames()[in.byte() % attributeNames().size()];
        std::string value = in.piece();
        // Values the file system refuses (too large) are not the test's business.
        ::setxattr(path.c_str(), ("user." + name).c_str(), value.data(), value.size(), 0);
    }

    Url url = Url::fileURLWithPath(path);
    ItemMetadata first = ItemMetadata::read(url);
    ItemMetadata settled = ItemMetadata::read(url);
    check(same(first, settled));
    if (settled.tagData) {
        auto tags = GetTagsFromTagsData(*settled.tagData);
        check(tags && settled.tagLabels && tags->size() == settled.tagLabels->size());
        for (size_t i = 0; i < tags->size(); ++i)
            check((*tags)[i]->label() == (*settled.tagLabels)[i]);
    } else {
        check(!settled.tagLabels);
    }

    auto item = LocalItem::make(Url::fileURLWithPath(path));
    check(item != nullptr);
    check(same(item->lastUsedDate(), settled.lastUsedDate) && item->tagData() == settled.tagData &&
          same(item->favoriteRank(), settled.favoriteRank));

    if (auto back = item->putBackURL()) {
        const std::string storage = fuzz::scratchFolder(nullptr) + "/storage/";
        check(settled.putBack && back->isFileURL() && back->path().starts_with(storage) &&
              back->path().size() > storage.size());
    }

    check(ItemMetadata::writeLastUsedDate(url, settled.lastUsedDate).ok());
    check(ItemMetadata::writeFavoriteRank(url, settled.favoriteRank).ok());
    check(ItemMetadata::writeTrashDate(url, settled.trashDate).ok());
    check(ItemMetadata::writePutBack(url, settled.putBack).ok());
    if (settled.tagData)
        check(ItemMetadata::writeTagData(url, settled.tagData).ok());
    check(same(ItemMetadata::read(url), settled));
    return 0;
}
