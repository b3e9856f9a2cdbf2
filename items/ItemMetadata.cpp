#include "items/ItemMetadata.h"

#include <cerrno>
#include <set>

#include "host/UrlOperations.h"
#include "items/ExtendedAttributes.h"
#include "items/LocalItem.h"
#include "items/UnarchiveLogged.h"
#include "platform/FileSystem.h"
#include "platform/Tag.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/objects/Array.h"
#include "platform/strata/StrataService.h"
#include "support/Log.h"

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

std::optional<std::vector<std::string>> labelsFromArchive(const Bytes& data) {
    auto root = KeyedUnarchiver::unarchivedObjectOfClasses(
        {std::string(Array::kClassName), std::string(String::kClassName)}, data);
    if (!root.ok())
        return std::nullopt;
    auto array = objectCast<Array>(root.value());
    if (!array)
        return std::nullopt;
    std::vector<std::string> labels;
    labels.reserve(array->count());
    for (const auto& element : array->objects()) {
        auto label = objectCast<String>(element);
        if (!label)
            return std::nullopt;
        labels.push_back(label->value());
    }
    return labels;
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

Status writeObject(const Url& url, const std::string& name, const ObjectRef& object) {
    auto data = archiveOrNothing(object);
    if (!data.ok()) {
        logError("can't archive value for xattr " + name + "; " + data.error().description());
        return data.error();
    }
    return ItemMetadata::writeAttributeData(url, name, data.value());
}

// The document's copy of its metadata follows what Tamber writes at once, so that a save right
// after does not lose it while the attribute event waits in the journal.
void noteWritten(int fd, const std::optional<Bytes>& data, const std::string& name) {
    if (auto strata = StrataService::current())
        strata->metadataAttributeWritten(fd, name, data);
}

// The names of the attributes present, or nothing when the listing failed (then every
// attribute is read one by one, which reports the failure the usual way).
std::optional<std::set<std::string>> listAttributes(const Url& url) {
    FileSystem& fs = FileSystem::current();
    std::string buffer(256, '\0');
    for (int attempt = 0; attempt < 4; ++attempt) {
        ssize_t n = fs.llistxattr(url.path(), buffer.data(), buffer.size());
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
        ssize_t needed = fs.llistxattr(url.path(), nullptr, 0);
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

std::optional<std::vector<std::string>> ItemMetadata::readTagLabels(const Url& url) {
    auto data = ReadXattrData(LocalItem::xattrTagDataName(), url);
    if (!data)
        return std::nullopt;
    return labelsFromArchive(*data);
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
    if (has(LocalItem::xattrTagDataName())) {
        m.tagLabels = readTagLabels(url);
        if (m.tagLabels)
            m.tagData = tagDataForLabels(*m.tagLabels);
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
    std::vector<ObjectRef> labels;
    if (tagData) {
        if (auto tags = GetTagsFromTagsData(*tagData)) {
            for (const auto& tag : *tags) labels.push_back(String::make(tag->label()));
        }
    }
    return writeObject(url, LocalItem::xattrTagDataName(), Array::make(std::move(labels)));
}

Status ItemMetadata::writeFavoriteRank(const Url& url, const std::shared_ptr<const Number>& rank) {
    return writeObject(url, LocalItem::xattrFavoriteRankName(), rank);
}

Status ItemMetadata::writeTrashDate(const Url& url, const std::shared_ptr<const Date>& date) {
    return writeObject(url, LocalItem::xattrTrashDateName(), date);
}

Status ItemMetadata::writeAttributeData(const Url& url, const std::string& name,
                                        const std::optional<Bytes>& data) {
    Status written;
    bool ok = pt_withReadWriteAccess(url, [&](int fd) {
        written = SetOrRemoveXattr(fd, data, name);
        if (!written.ok())
            return false;
        noteWritten(fd, data, name);
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

Status ItemMetadata::writePutBack(const Url& url, const std::shared_ptr<const String>& path) {
    return writeObject(url, LocalItem::xattrTrashPutBackName(), path);
}

}  // namespace tamber
