#include "applibraries/LocalAppLibraryCache.h"

#include <algorithm>
#include <cstdlib>
#include <limits>
#include <string_view>

#include "items/UnarchiveLogged.h"
#include "platform/FileContents.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/objects/Array.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "support/Log.h"
#include "support/MutexLock.h"
#include "support/ProcessWide.h"

namespace tamber {

namespace {

constexpr const char* kVersionTokenKey = "versionToken";
constexpr const char* kBundleProxyKey = "bundleProxy";
constexpr size_t kAbbreviatedComponents = 4;

// The user's application-support directory. Without an absolute home there is nowhere to keep
// the cache: a broken environment, not a failure to report.
Url applicationSupportURL() {
    const char* dataHome = std::getenv("XDG_DATA_HOME");
    if (dataHome && dataHome[0] == '/')
        return Url::fileURLWithPath(dataHome);
    const char* home = std::getenv("HOME");
    if (home && home[0] == '/')
        return Url::fileURLWithPath(std::string(home) + "/.local/share");
    fatalError(
        "can't find the application support directory: neither XDG_DATA_HOME nor HOME is "
        "an absolute path");
}

std::string_view fileName(LocalAppLibraryCacheSource source) {
    return source == LocalAppLibraryCacheSource::main ? "app-libraries.plist"
                                                      : "searchable-app-libraries.plist";
}

struct SharedCaches {
    Mutex mutex;
    std::shared_ptr<LocalAppLibraryCache> main GUARDED_BY(mutex);
    std::shared_ptr<LocalAppLibraryCache> workingSet GUARDED_BY(mutex);
};

SharedCaches& sharedCaches() {
    // Blocks on the caches' queues may run while the process exits.
    static ProcessWide<SharedCaches> caches;
    return *caches;
}

}  // namespace

std::shared_ptr<LocalAppLibraryCache> LocalAppLibraryCache::forSource(
    LocalAppLibraryCacheSource source) {
    SharedCaches& caches = sharedCaches();
    MutexLock lock(caches.mutex);
    auto& slot = source == LocalAppLibraryCacheSource::main ? caches.main : caches.workingSet;
    if (!slot) {
        Url url = applicationSupportURL().appendingPathComponent("Tamber").appendingPathComponent(
            fileName(source));
        slot = std::make_shared<LocalAppLibraryCache>(Private{}, source, std::move(url));
    }
    return slot;
}

std::shared_ptr<LocalAppLibraryCache> LocalAppLibraryCache::mainCache() {
    return forSource(LocalAppLibraryCacheSource::main);
}

std::shared_ptr<LocalAppLibraryCache> LocalAppLibraryCache::workingSetCache() {
    return forSource(LocalAppLibraryCacheSource::workingSet);
}

void LocalAppLibraryCache::resetSharedForTesting() {
    SharedCaches& caches = sharedCaches();
    MutexLock lock(caches.mutex);
    caches.main.reset();
    caches.workingSet.reset();
}

LocalAppLibraryCache::LocalAppLibraryCache(Private, LocalAppLibraryCacheSource source, Url cacheURL)
    : source_(source),
      queue_(
          DispatchQueue::makeSerial("tamber.app-library-cache." + std::string(shortLabel(source)))),
      cacheURL_(std::move(cacheURL)) {
    BundleRecord::registerArchiveClass();
}

uint64_t LocalAppLibraryCache::versionToken() const {
    queue_->assertCurrent();
    return versionToken_;
}

LocalAppLibraryCache::Content LocalAppLibraryCache::load() {
    queue_->assertCurrent();
    auto read = FileContents::read(cacheURL_);
    if (!read.ok()) {
        if (read.error().is(kHostPlatformErrorDomain, kHostPlatformFileNoSuchFile)) {
            logDebug("nothing cached on disk");
        } else {
            logError("can't load cache from disk let's reset; " + read.error().description());
        }
        return {};
    }
    const Bytes& data = read.value();
    logDebug([&] {
        return "read from disk " + std::to_string(data.size()) + " bytes at " +
               abbreviatedPath(cacheURL_);
    });

    auto root = UnarchiveLogged<Dictionary>(data);
    if (!root)
        return {};
    // Only an unsigned value is a token: anything else was not written by save().
    auto token = objectCast<Number>(root->objectForKey(kVersionTokenKey));
    if (!token || token->kind() != Number::Kind::Unsigned) {
        logDebug("version token invalid; data on disk is corrupted let's reset");
        return {};
    }
    auto array = objectCast<Array>(root->objectForKey(kBundleProxyKey));
    std::vector<BundleRecordRef> records;
    if (array) {
        records.reserve(array->count());
        for (const ObjectRef& object : array->objects()) {
            auto record = objectCast<BundleRecord>(object);
            if (!record) {
                array = nullptr;
                break;
            }
            records.push_back(std::move(record));
        }
    }
    if (!array) {
        logDebug("bundle proxies invalid; data on disk is corrupted let's reset");
        return {};
    }
    logDebug([&] {
        return "loaded " + std::to_string(records.size()) + " app library items from data";
    });

    uint64_t loaded = token->uint64Value();
    if (versionToken_ < loaded) {
        versionToken_ = loaded;
        logDebug(
            [&] { return "version token was set to " + std::to_string(loaded) + " after load"; });
    }
    return {loaded, std::move(records)};
}

Result<uint64_t> LocalAppLibraryCache::save(const std::vector<BundleRecordRef>& bundleRecords,
                                            uint64_t versionToken, bool bumpVersion) {
    queue_->assertCurrent();
    if (auto status = FileContents::createDirectory(cacheURL_.deletingLastPathComponent());
        !status.ok())
        return status.error();

    uint64_t token = versionToken;
    if (bumpVersion) {
        if (versionToken_ == std::numeric_limits<uint64_t>::max())
            fatalError("app library cache version token overflows");
        token = versionToken_ + 1;
    }

    std::vector<ObjectRef> objects(bundleRecords.begin(), bundleRecords.end());
    auto root = Dictionary::make({{kVersionTokenKey, Number::fromUInt64(token)},
                                  {kBundleProxyKey, Array::make(std::move(objects))}});
    auto data = KeyedArchiver::archivedDataWithRootObject(root);
    if (!data.ok())
        return data.error();
    if (auto status = FileContents::writeAtomically(cacheURL_, data.value()); !status.ok())
        return status.error();
    logDebug([&] {
        return "wrote on disk " + std::to_string(data.value().size()) + " bytes at " +
               abbreviatedPath(cacheURL_);
    });

    versionToken_ = token;
    return token;
}

std::string LocalAppLibraryCache::abbreviatedPath(const Url& url) const {
    queue_->assertCurrent();
    std::vector<std::string> components = url.pathComponents();
    // The first component is the root "/", which is not a name.
    size_t names = components.empty() ? 0 : components.size() - 1;
    size_t first = components.size() - std::min(names, kAbbreviatedComponents);
    std::string text = "~/";
    for (size_t i = first; i < components.size(); ++i) {
        if (i > first)
            text += "/";
        text += components[i];
    }
    return text;
}

}  // namespace tamber
