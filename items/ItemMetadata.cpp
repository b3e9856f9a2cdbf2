#include "items/ItemMetadata.h"

#include <cerrno>
#include <functional>
#include <set>

#include "host/UrlOperations.h"
#include "items/ExtendedAttributes.h"
#include "items/LocalItem.h"
#include "items/UnarchiveLogged.h"
#include "items/XdgTagList.h"
#include "platform/FileSystem.h"
#include "platform/OpenFolder.h"
#include "platform/Tag.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/objects/Array.h"
#include "platform/strata/StrataService.h"
#include "support/Log.h"
#include "support/MutexLock.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

template <class T>
std::shared_ptr<const T> decodeAttribute(const std::string& name, const Url& url) {
    auto data = ReadXattrData(name, url);
    if (!data)
        return nullptr;
    auto value = KeyedUnarchiver::unarchivedObjectOfClass<T>(*data);
    return value.ok() ? value.value() : nullptr;
}

using Tags = XdgTagList::Tags;

// Tamber's tags attribute: an archived array of labels. Colours are not stored: every tag
// read back has colour 0.
std::optional<Tags> tagsFromArchive(const Bytes& data) {
    auto root = KeyedUnarchiver::unarchivedObjectOfClasses(
        {std::string(Array::kClassName), std::string(String::kClassName)}, data);
    if (!root.ok())
        return std::nullopt;
    auto array = objectCast<Array>(root.value());
    if (!array)
        return std::nullopt;
    Tags tags;
    tags.reserve(array->count());
    for (const auto& element : array->objects()) {
        auto label = objectCast<String>(element);
        if (!label)
            return std::nullopt;
        tags.push_back(Tag::make(label->value(), 0));
    }
    return tags;
}

ObjectRef archiveRootForTags(const Tags& tags) {
    std::vector<ObjectRef> labels;
    labels.reserve(tags.size());
    for (const auto& tag : tags) labels.push_back(String::make(tag->label()));
    return Array::make(std::move(labels));
}

std::vector<std::string> labelsOf(const Tags& tags) {
    std::vector<std::string> labels;
    labels.reserve(tags.size());
    for (const auto& tag : tags) labels.push_back(tag->label());
    return labels;
}

bool sameTags(const Tags& a, const Tags& b) {
    if (a.size() != b.size())
        return false;
    for (size_t i = 0; i < a.size(); ++i)
        if (!a[i]->isEqual(*b[i]))
            return false;
    return true;
}

// Tag writes and the taking in of the desktop list run one at a time in the process, so that
// neither writes back tags it read before the other changed them.
Mutex& tagsMutex() {
    static ProcessWide<Mutex> mutex;
    return *mutex;
}

// Archives `object`, or nothing for a null object (which removes the attribute).
Result<std::optional<Bytes>> archiveOrNothing(const ObjectRef& object) {
    if (!object)
        return std::optional<Bytes>();
    auto data = KeyedArchiver::archivedDataWithRootObject(object);
    if (!data.ok())
        return data.error();
    return std::optional<Bytes>(std::move(data.value()));
}

Status writeAttributeThen(const Url& url, const std::string& name, const std::optional<Bytes>& data,
                          const std::function<void(int)>& then);

Status writeObject(const Url& url, const std::string& name, const ObjectRef& object,
                   const std::function<void(int)>& then = {}) {
    auto data = archiveOrNothing(object);
    if (!data.ok()) {
        logError("can't archive value for xattr " + name + "; " + data.error().description());
        return data.error();
    }
    return writeAttributeThen(url, name, data.value(), then);
}

// The document's copy of its metadata follows what Tamber writes at once, so that a save right
// after does not lose it while the attribute event waits in the journal.
void noteWritten(int fd, const std::optional<Bytes>& data, const std::string& name) {
    if (auto strata = StrataService::current())
        strata->metadataAttributeWritten(fd, name, data);
}

// Notes on the item that the desktop list now is `list` (nothing: no list), as Tamber wrote or
// took it in.
void noteDesktopListSynced(int fd, const std::optional<Bytes>& list) {
    std::optional<Bytes> note;
    if (list)
        note = XdgTagList::fingerprint(*list);
    if (SetOrRemoveXattr(fd, note, XdgTagList::syncedAttributeName()).ok())
        noteWritten(fd, note, XdgTagList::syncedAttributeName());
}

// After Tamber's own attribute took `tags`: the desktop list follows. Tamber's attribute is the
// record, so a desktop list that cannot be written fails nothing: SetOrRemoveXattr has logged it
// once, and the list and its note stay as they were, so the stale list is not later taken for
// another program's change.
void mirrorToDesktopList(int fd, const Tags& tags) {
    std::optional<Bytes> list = XdgTagList::format(labelsOf(tags));
    if (!SetOrRemoveXattr(fd, list, XdgTagList::attributeName()).ok())
        return;
    noteWritten(fd, list, XdgTagList::attributeName());
    noteDesktopListSynced(fd, list);
}

Status writeTags(const Url& url, const Tags& tags, const std::function<void(int)>& then) {
    return writeObject(url, LocalItem::xattrTagDataName(), archiveRootForTags(tags), then);
}

// When the desktop list is not the one Tamber last wrote or took in, another program changed
// it: Tamber's tags become that list (tags the list cannot hold are kept) and the
// list is noted as taken in. Our own write of the list leaves the note matching, so it is never
// read back as a change. Returns the tags to show, or nothing when Tamber's stand.
std::optional<Bytes> desktopListIfChanged(const Url& url, bool& changed) {
    auto theirs = ReadXattrData(XdgTagList::attributeName(), url);
    auto note = ReadXattrData(XdgTagList::syncedAttributeName(), url);
    std::optional<Bytes> expected;
    if (theirs)
        expected = XdgTagList::fingerprint(*theirs);
    changed = note != expected;
    return theirs;
}

std::optional<Tags> takeInDesktopList(const Url& url) {
    bool changed = false;
    // The common case, a list in step, looks without waiting for writers elsewhere.
    (void)desktopListIfChanged(url, changed);
    if (!changed)
        return std::nullopt;
    MutexLock lock(tagsMutex());
    auto theirs = desktopListIfChanged(url, changed);
    if (!changed)
        return std::nullopt;
    const std::optional<Tags> stored = ItemMetadata::readTags(url);
    Tags ours = stored.value_or(Tags{});
    std::vector<std::string> listed;
    if (theirs)
        listed = XdgTagList::parse(
            std::string_view(reinterpret_cast<const char*>(theirs->data()), theirs->size()));
    Tags merged = XdgTagList::merged(ours, listed);
    logDebug([&] { return "taking in the desktop tags of " + url.absoluteString(); });
    auto noteIt = [&](int fd) { noteDesktopListSynced(fd, theirs); };
    if (sameTags(merged, ours)) {
        pt_withReadWriteAccess(url, [&](int fd) {
            noteIt(fd);
            return true;
        });
        // Nothing written: a file without tags of ours reads as untagged, as it will next time.
        if (!stored)
            return std::nullopt;
    } else {
        // Should the write fail (logged), the record still shows what the desktop holds.
        (void)writeTags(url, merged, noteIt);
    }
    return merged;
}

// The names of the attributes present, or nothing when the listing failed (then every
// attribute is read one by one, which reports the failure the usual way).
std::optional<std::set<std::string>> listAttributes(const Url& url) {
    FileSystem& fs = FileSystem::current();
    // A URL made in a folder a listing holds open is read relative to it.
    const OpenFolderRef folder = url.openFolder();
    const std::string name = folder ? url.lastPathComponent() : std::string();
    auto list = [&](char* into, size_t size) {
        return folder ? fs.llistxattrAt(folder->fd(), name, url.path(), into, size)
                      : fs.llistxattr(url.path(), into, size);
    };
    std::string buffer(256, '\0');
    for (int attempt = 0; attempt < 4; ++attempt) {
        ssize_t n = list(buffer.data(), buffer.size());
        if (n >= 0) {
            std::set<std::string> names;
            for (size_t start = 0; start < static_cast<size_t>(n);) {
                size_t end = buffer.find('\0', start);
                if (end == std::string::npos || end > static_cast<size_t>(n))
                    end = n;
                if (end > start)
                    names.emplace(buffer, start, end - start);
                start = end + 1;
            }
            return names;
        }
        if (errno != ERANGE)
            return std::nullopt;
        ssize_t needed = list(nullptr, 0);
        if (needed < 0)
            return std::nullopt;
        buffer.assign(static_cast<size_t>(needed) + 64, '\0');
    }
    return std::nullopt;
}

}  // namespace

std::shared_ptr<const Date> ItemMetadata::readLastUsedDate(const Url& url) {
    return decodeAttribute<Date>(LocalItem::xattrLastUsedDateName(), url);
}

std::optional<std::vector<std::shared_ptr<const Tag>>> ItemMetadata::readTags(const Url& url) {
    auto data = ReadXattrData(LocalItem::xattrTagDataName(), url);
    if (!data)
        return std::nullopt;
    return tagsFromArchive(*data);
}

std::optional<std::vector<std::string>> ItemMetadata::readTagLabels(const Url& url) {
    auto tags = readTags(url);
    if (!tags)
        return std::nullopt;
    return labelsOf(*tags);
}

std::shared_ptr<const Number> ItemMetadata::readFavoriteRank(const Url& url) {
    return decodeAttribute<Number>(LocalItem::xattrFavoriteRankName(), url);
}

std::shared_ptr<const Date> ItemMetadata::readTrashDate(const Url& url) {
    auto data = ReadXattrData(LocalItem::xattrTrashDateName(), url);
    if (!data)
        return nullptr;
    return UnarchiveLogged<Date>(*data);
}

std::shared_ptr<const String> ItemMetadata::readPutBack(const Url& url) {
    return decodeAttribute<String>(LocalItem::xattrTrashPutBackName(), url);
}

ItemMetadata ItemMetadata::read(const Url& url) {
    ItemMetadata m;
    auto present = listAttributes(url);
    auto has = [&](const std::string& name) { return !present || present->count(name) > 0; };
    if (present && present->empty())
        return m;
    if (has(LocalItem::xattrLastUsedDateName()))
        m.lastUsedDate = readLastUsedDate(url);
    std::optional<Tags> tags;
    if (has(XdgTagList::attributeName()) || has(XdgTagList::syncedAttributeName()))
        tags = takeInDesktopList(url);
    if (!tags && has(LocalItem::xattrTagDataName()))
        tags = readTags(url);
    if (tags) {
        m.tagLabels = labelsOf(*tags);
        m.tagData = GetTagsDataForTags(*tags);
    }
    if (has(LocalItem::xattrFavoriteRankName()))
        m.favoriteRank = readFavoriteRank(url);
    if (has(LocalItem::xattrTrashDateName()))
        m.trashDate = readTrashDate(url);
    if (has(LocalItem::xattrTrashPutBackName()))
        m.putBack = readPutBack(url);
    return m;
}

Bytes ItemMetadata::tagDataForLabels(const std::vector<std::string>& labels) {
    std::vector<std::shared_ptr<const Tag>> tags;
    tags.reserve(labels.size());
    for (const auto& label : labels) tags.push_back(Tag::make(label, 0));
    return GetTagsDataForTags(tags);
}

Status ItemMetadata::writeLastUsedDate(const Url& url, const std::shared_ptr<const Date>& date) {
    return writeObject(url, LocalItem::xattrLastUsedDateName(), date);
}

Status ItemMetadata::writeTagData(const Url& url, const std::optional<Bytes>& tagData) {
    Tags tags;
    if (tagData) {
        if (auto decoded = GetTagsFromTagsData(*tagData))
            tags = std::move(*decoded);
    }
    MutexLock lock(tagsMutex());
    return writeTags(url, tags, [&](int fd) { mirrorToDesktopList(fd, tags); });
}

Status ItemMetadata::writeFavoriteRank(const Url& url, const std::shared_ptr<const Number>& rank) {
    return writeObject(url, LocalItem::xattrFavoriteRankName(), rank);
}

Status ItemMetadata::writeTrashDate(const Url& url, const std::shared_ptr<const Date>& date) {
    return writeObject(url, LocalItem::xattrTrashDateName(), date);
}

Status ItemMetadata::writeAttributeData(const Url& url, const std::string& name,
                                        const std::optional<Bytes>& data) {
    return writeAttributeThen(url, name, data, {});
}

namespace {

// Writes `name`, then runs `then` on the same descriptor when that worked.
Status writeAttributeThen(const Url& url, const std::string& name, const std::optional<Bytes>& data,
                          const std::function<void(int)>& then) {
    Status written;
    bool ok = pt_withReadWriteAccess(url, [&](int fd) {
        written = SetOrRemoveXattr(fd, data, name);
        if (!written.ok())
            return false;
        noteWritten(fd, data, name);
        if (then)
            then(fd);
        return true;
    });
    if (ok)
        return Status::OK();
    // The attribute call's own error when it was the one that failed, else the access's.
    Error error = written.ok() ? Error::errorWithPOSIXCode(errno) : written.error();
    logError("can't set xattr " + name + " on " + url.absoluteString() + "; " +
             error.description());
    return error;
}

}  // namespace

Status ItemMetadata::writePutBack(const Url& url, const std::shared_ptr<const String>& path) {
    return writeObject(url, LocalItem::xattrTrashPutBackName(), path);
}

}  // namespace tamber
