// Feeds arbitrary bytes to the loading of the two app-library cache files (the first byte picks
// the file, the rest is its content). Loading never fails, whatever the file holds; what it
// loads, the cache must be able to save and load again unchanged (token and records), and the
// cache's own token never falls below one it loaded.
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>

#include "applibraries/LocalAppLibraryCache.h"
#include "fuzz/support/FuzzSupport.h"

using namespace tamber;

namespace {

bool sameRecords(const std::vector<BundleRecordRef>& a, const std::vector<BundleRecordRef>& b) {
    if (a.size() != b.size())
        return false;
    for (size_t i = 0; i < a.size(); ++i)
        if (!a[i] || !b[i] || !a[i]->isEqual(*b[i]))
            return false;
    return true;
}

std::shared_ptr<LocalAppLibraryCache> cacheFor(uint8_t selector) {
    static bool ready = [] {
        fuzz::silenceLog();
        ::setenv("XDG_DATA_HOME", fuzz::scratchFolder("app-cache").c_str(), 1);
        LocalAppLibraryCache::resetSharedForTesting();
        std::filesystem::create_directories(fuzz::scratchFolder(nullptr) + "/Tamber");
        return true;
    }();
    (void)ready;
    return selector & 1 ? LocalAppLibraryCache::workingSetCache()
                        : LocalAppLibraryCache::mainCache();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0)
        return 0;
    auto cache = cacheFor(data[0]);
    {
        std::ofstream file(cache->cacheURL().path(), std::ios::binary | std::ios::trunc);
        file.write(reinterpret_cast<const char*>(data + 1), std::streamsize(size - 1));
    }
    cache->queue().sync([&] {
        LocalAppLibraryCache::Content loaded = cache->load();
        if (cache->versionToken() < loaded.versionToken)
            std::abort();
        for (const auto& record : loaded.bundleRecords)
            if (!record)
                std::abort();
        if (loaded.versionToken == 0 && loaded.bundleRecords.empty())
            return;
        auto saved = cache->save(loaded.bundleRecords, loaded.versionToken, false);
        if (!saved.ok() || saved.value() != loaded.versionToken)
            std::abort();
        LocalAppLibraryCache::Content again = cache->load();
        if (again.versionToken != loaded.versionToken ||
            !sameRecords(again.bundleRecords, loaded.bundleRecords))
            std::abort();
    });
    return 0;
}
