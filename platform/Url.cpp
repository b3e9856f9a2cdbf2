#include "platform/Url.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <mutex>
#include <tuple>

#include "platform/ResourceValues.h"
#include "platform/UrlPath.h"
#include "platform/objects/Number.h"

namespace tamber {

struct Url::Storage {
    bool isFile = false;
    std::string text;  // the standardised path of a file URL, else the URL as given

    // The folder the URL was made in, while whoever opened it keeps it open.
    std::weak_ptr<const OpenFolder> folder;

    std::mutex mutex;
    // Indexed by ResourceValues::indexOf; a key is cached when its bit is set (a cached value
    // may be null: "no value").
    std::array<ObjectRef, ResourceValues::kKeyCount> values;
    uint32_t cached = 0;
    // Bumped whenever cached values are removed, so that a read that was under way then does
    // not put back what the caller just dropped.
    uint64_t generation = 0;
};

namespace {

std::atomic<DocumentIdLookup> gDocumentIdLookup{nullptr};

// The cache, under the storage's mutex.
bool isCached(const Url::Storage& storage, int index) {
    return (storage.cached >> index) & 1;
}

// Keeps `value` unless one is cached already; answers what is cached then.
const ObjectRef& cacheValue(Url::Storage& storage, int index, ObjectRef value) {
    if (!isCached(storage, index)) {
        storage.values[index] = std::move(value);
        storage.cached |= 1u << index;
    }
    return storage.values[index];
}

std::shared_ptr<Url::Storage> makeStorage(bool isFile, std::string text) {
    auto storage = std::make_shared<Url::Storage>();
    storage->isFile = isFile;
    storage->text = std::move(text);
    return storage;
}

bool isSchemeCharacter(char c, bool first) {
    bool alpha = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
    if (first)
        return alpha;
    return alpha || (c >= '0' && c <= '9') || c == '+' || c == '-' || c == '.';
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(), [](char x, char y) {
        auto lower = [](char c) { return c >= 'A' && c <= 'Z' ? char(c - 'A' + 'a') : c; };
        return lower(x) == lower(y);
    });
}

Error notAFileUrlError(const std::string& text) {
    return Error(kPosixErrorDomain, EINVAL,
                 {{"description", "Resource values need a file URL, not \"" + text + "\"."}});
}

// The path of a "file:" URL after the scheme, or nothing when it is not one we can read.
std::optional<std::string> filePathOf(std::string_view rest) {
    // A query or fragment has no meaning for a file.
    rest = rest.substr(0, rest.find_first_of("?#"));
    if (rest.starts_with("//")) {
        rest.remove_prefix(2);
        size_t slash = rest.find('/');
        std::string_view host = rest.substr(0, slash);
        if (!host.empty() && !equalsIgnoringCase(host, "localhost"))
            return std::nullopt;
        rest = slash == std::string_view::npos ? std::string_view("/") : rest.substr(slash);
    } else if (!rest.starts_with('/')) {
        return std::nullopt;
    }
    std::optional<std::string> decoded = UrlPath::percentDecode(rest);
    if (!decoded)
        return std::nullopt;
    return UrlPath::standardize(*decoded);
}

}  // namespace

Url::Url() : storage_(makeStorage(false, {})) {}

Url::Url(std::shared_ptr<Storage> storage) : storage_(std::move(storage)) {}

Url Url::fileURLInFolder(const std::shared_ptr<const OpenFolder>& folder, std::string_view name) {
    std::string path;
    path.reserve(folder->path().size() + 1 + name.size());
    path.append(folder->path());
    if (!path.ends_with('/'))
        path.push_back('/');
    path.append(name);
    auto storage = makeStorage(true, std::move(path));
    storage->folder = folder;
    return Url(std::move(storage));
}

std::shared_ptr<const OpenFolder> Url::openFolder() const {
    return storage_->folder.lock();
}

Url Url::fileURLWithPath(std::string_view path) {
    std::string base = path.starts_with('/') ? std::string("/") : UrlPath::workingDirectory();
    return Url(makeStorage(true, UrlPath::standardize(path, base)));
}

std::optional<Url> Url::parse(std::string_view string) {
    size_t colon = string.find(':');
    if (colon == std::string_view::npos || colon == 0)
        return std::nullopt;
    for (size_t i = 0; i < colon; ++i) {
        if (!isSchemeCharacter(string[i], i == 0))
            return std::nullopt;
    }
    if (!equalsIgnoringCase(string.substr(0, colon), "file")) {
        return Url(makeStorage(false, std::string(string)));
    }
    std::optional<std::string> path = filePathOf(string.substr(colon + 1));
    if (!path)
        return std::nullopt;
    return Url(makeStorage(true, std::move(*path)));
}

bool Url::isFileURL() const {
    return storage_->isFile;
}

bool Url::isEmpty() const {
    return !storage_->isFile && storage_->text.empty();
}

const std::string& Url::path() const {
    static const std::string kEmpty;
    return storage_->isFile ? storage_->text : kEmpty;
}

std::string Url::absoluteString() const {
    if (!storage_->isFile)
        return storage_->text;
    return "file://" + UrlPath::percentEncode(storage_->text);
}

std::string Url::lastPathComponent() const {
    if (!storage_->isFile)
        return {};
    return std::string(UrlPath::lastComponent(storage_->text));
}

std::string Url::pathExtension() const {
    if (!storage_->isFile)
        return {};
    return std::string(UrlPath::extension(UrlPath::lastComponent(storage_->text)));
}

std::vector<std::string> Url::pathComponents() const {
    if (!storage_->isFile)
        return {};
    return UrlPath::components(storage_->text);
}

Url Url::deletingLastPathComponent() const {
    if (!storage_->isFile)
        return Url(makeStorage(false, storage_->text));
    return Url(makeStorage(true, std::string(UrlPath::deletingLastComponent(storage_->text))));
}

Url Url::appendingPathComponent(std::string_view component) const {
    if (!storage_->isFile) {
        std::string text = storage_->text;
        if (!text.ends_with('/'))
            text.push_back('/');
        text.append(component);
        return Url(makeStorage(false, std::move(text)));
    }
    std::string path = storage_->text;
    path.push_back('/');
    path.append(component);
    return Url(makeStorage(true, UrlPath::standardize(path)));
}

Result<ObjectRef> Url::resourceValue(ResourceKey key) const {
    if (!storage_->isFile)
        return notAFileUrlError(storage_->text);
    const int index = ResourceValues::indexOf(key);
    if (index < 0)
        return ResourceValues::unknownKeyError(key);
    uint64_t generation;
    {
        std::lock_guard lock(storage_->mutex);
        if (isCached(*storage_, index))
            return storage_->values[index];
        generation = storage_->generation;
    }
    const auto folder = storage_->folder.lock();

    ObjectRef value;
    if (key == ResourceKeys::kDocumentID) {
        // Only a found ID is kept: the service may assign one later.
        DocumentIdLookup lookup = gDocumentIdLookup.load();
        std::optional<uint32_t> id = lookup ? lookup(storage_->text) : std::nullopt;
        if (!id) {
            // No ID yet is a normal answer for a file that exists; a vanished file is an error,
            // as for every other key.
            Result<std::vector<ObjectRef>> exists =
                ResourceValues::read(storage_->text, {ResourceKeys::kFileID}, folder.get());
            if (!exists.ok())
                return exists.error();
            return ObjectRef();
        }
        value = Number::fromUInt64(*id);
    } else {
        Result<std::vector<ObjectRef>> values =
            ResourceValues::read(storage_->text, {key}, folder.get());
        if (!values.ok())
            return values.error();
        value = std::move(values->front());
    }

    std::lock_guard lock(storage_->mutex);
    if (storage_->generation == generation) {
        // A value set meanwhile wins over the one read.
        return cacheValue(*storage_, index, std::move(value));
    }
    return value;
}

Status Url::setResourceValue(const ObjectRef& value, ResourceKey key) const {
    if (!storage_->isFile)
        return notAFileUrlError(storage_->text);
    if (key != ResourceKeys::kFileID && key != ResourceKeys::kDocumentID) {
        return Error(kPosixErrorDomain, EINVAL,
                     {{"description", "The resource value " + std::string(key) +
                                          " can't be set; only the file and document IDs can."},
                      {"key", std::string(key)}});
    }
    const int index = ResourceValues::indexOf(key);
    std::lock_guard lock(storage_->mutex);
    storage_->values[index] = value;
    storage_->cached |= 1u << index;
    return Status::OK();
}

Status Url::prefetchResourceValues(const std::vector<ResourceKey>& keys) const {
    if (!storage_->isFile)
        return notAFileUrlError(storage_->text);
    std::vector<ResourceKey> fromFile;
    bool wantsDocumentID = false;
    uint64_t generation;
    {
        std::lock_guard lock(storage_->mutex);
        for (ResourceKey key : keys) {
            const int index = ResourceValues::indexOf(key);
            if (index < 0)
                return ResourceValues::unknownKeyError(key);
            if (isCached(*storage_, index))
                continue;
            if (key == ResourceKeys::kDocumentID) {
                wantsDocumentID = true;
            } else if (std::find(fromFile.begin(), fromFile.end(), key) == fromFile.end()) {
                fromFile.push_back(key);
            }
        }
        generation = storage_->generation;
    }

    std::vector<ObjectRef> values;
    if (!fromFile.empty()) {
        const auto folder = storage_->folder.lock();
        Result<std::vector<ObjectRef>> read =
            ResourceValues::read(storage_->text, fromFile, folder.get());
        if (!read.ok())
            return read.error();
        values = std::move(*read);
    }
    if (wantsDocumentID) {
        DocumentIdLookup lookup = gDocumentIdLookup.load();
        std::optional<uint32_t> id = lookup ? lookup(storage_->text) : std::nullopt;
        if (id) {
            fromFile.push_back(ResourceKeys::kDocumentID);
            values.push_back(Number::fromUInt64(*id));
        }
    }

    std::lock_guard lock(storage_->mutex);
    if (storage_->generation != generation)
        return Status::OK();
    for (size_t i = 0; i < fromFile.size(); ++i) {
        (void)cacheValue(*storage_, ResourceValues::indexOf(fromFile[i]), std::move(values[i]));
    }
    return Status::OK();
}

void Url::removeCachedResourceValue(ResourceKey key) const {
    const int index = ResourceValues::indexOf(key);
    std::lock_guard lock(storage_->mutex);
    if (index >= 0) {
        storage_->values[index] = nullptr;
        storage_->cached &= ~(1u << index);
    }
    ++storage_->generation;
}

void Url::removeAllCachedResourceValues() const {
    std::lock_guard lock(storage_->mutex);
    storage_->values = {};
    storage_->cached = 0;
    ++storage_->generation;
}

bool operator==(const Url& a, const Url& b) {
    return a.storage_->isFile == b.storage_->isFile && a.storage_->text == b.storage_->text;
}

bool operator<(const Url& a, const Url& b) {
    return std::tie(a.storage_->isFile, a.storage_->text) <
           std::tie(b.storage_->isFile, b.storage_->text);
}

bool UrlObject::isEqual(const Object& other) const {
    auto* url = dynamic_cast<const UrlObject*>(&other);
    return url && url->url_ == url_;
}

void setDocumentIdLookup(DocumentIdLookup lookup) {
    gDocumentIdLookup.store(lookup);
}

}  // namespace tamber
