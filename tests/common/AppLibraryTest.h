#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <mutex>

#include "applibraries/LocalAppLibraryCache.h"
#include "applibraries/LocalAppLibraryManager.h"
#include "applibraries/SharedAppLibraryLookup.h"
#include "host/HostPorterChangeObserver.h"
#include "host/RecordingHostPorterManager.h"
#include "items/LocalAppLibraryItem.h"
#include "platform/apps/AppRecord.h"
#include "platform/apps/AppRegistry.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber::testing {

using Identifiers = std::vector<HostPorterItemIdentifier>;

// Applications given by the test, per registry type, in order.
class FakeAppRegistry : public AppRegistry {
public:
    void replace(int type, std::vector<BundleRecordRef> records) {
        std::lock_guard lock(mutex_);
        records_[type] = std::move(records);
    }
    void enumerateApplicationsOfType(int type, const EnumerationBlock& block) override {
        std::unique_lock lock(mutex_);
        auto records = records_[type];
        lock.unlock();
        bool stop = false;
        for (size_t i = 0; i < records.size() && !stop; ++i) block(records[i], stop);
    }
    BundleRecordRef recordForBundleIdentifier(const std::string& bundleIdentifier) override {
        std::lock_guard lock(mutex_);
        for (const auto& [type, records] : records_)
            for (const auto& record : records)
                if (record && record->bundleIdentifier() == bundleIdentifier)
                    return record;
        return nullptr;
    }

private:
    std::mutex mutex_;
    std::map<int, std::vector<BundleRecordRef>> records_;
};

struct RecordingChangeObserver : HostPorterChangeObserver {
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        Identifiers ids;
        for (const auto& item : items) ids.push_back(item->itemIdentifier());
        updates.push_back(ids);
    }
    void didDeleteItemsWithIdentifiers(const Identifiers& ids) override {
        deletions.push_back(ids);
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor&, bool) override {}
    void finishEnumeratingWithError(const Error&) override {}
    std::vector<Identifiers> updates, deletions;
};

// Caches under a fresh XDG_DATA_HOME, a fake registry, a recording host and the shared app
// library lookup, all restored after.
class AppLibraryTest : public ::testing::Test {
protected:
    void SetUp() override {
        if (const char* old = std::getenv("XDG_DATA_HOME"))
            oldDataHome_ = old;
        ::setenv("XDG_DATA_HOME", dir.path().c_str(), 1);
        LocalAppLibraryManager::resetSharedForTesting();
        LocalAppLibraryCache::resetSharedForTesting();
        oldRegistry_ = AppRegistry::setDefaultRegistry(registry);
        host = std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(dir.makeDir("s")));
        oldHost_ = HostPorterManager::installDefaultManager(host);
        oldLookup_ = SharedAppLibraryLookup::install();
    }
    void TearDown() override {
        LocalAppLibraryManager::resetSharedForTesting();
        LocalAppLibraryCache::resetSharedForTesting();
        AppRegistry::setDefaultRegistry(oldRegistry_);
        HostPorterManager::installDefaultManager(oldHost_);
        AppLibraryLookup::setCurrent(oldLookup_);
        if (oldDataHome_)
            ::setenv("XDG_DATA_HOME", oldDataHome_->c_str(), 1);
        else
            ::unsetenv("XDG_DATA_HOME");
    }

    std::string container(const std::string& bundle) { return dir / ("apps/" + bundle); }
    Url documents(const std::string& bundle) {
        return Url::fileURLWithPath(container(bundle) + "/Documents");
    }
    // An application; its container gets a "Documents" folder unless it has none.
    std::shared_ptr<const AppRecord> app(const std::string& bundle,
                                         std::optional<bool> documentBrowser = true,
                                         bool inPlace = false, bool sharing = false,
                                         bool hasContainer = true) {
        BundleRecord::Fields fields{bundle, bundle + " app", std::nullopt, std::nullopt};
        if (hasContainer) {
            std::filesystem::create_directories(documents(bundle).path());
            fields.dataContainerURL = Url::fileURLWithPath(container(bundle));
        }
        std::shared_ptr<const Dictionary> info;
        if (documentBrowser) {
            info = Dictionary::make(
                {{"HostSupportsDocumentBrowser", Number::fromBool(*documentBrowser)}});
        }
        return AppRecord::make(fields, {inPlace, sharing, info});
    }
    // Lists these library apps, in this order, as the user's applications.
    void install(std::initializer_list<std::string> bundles) {
        std::vector<BundleRecordRef> records;
        for (const auto& bundle : bundles) records.push_back(app(bundle));
        registry->replace(AppRegistry::kUserApplications, records);
    }

    static LocalAppLibraryCache::Content load(LocalAppLibraryCacheSource source) {
        auto cache = LocalAppLibraryCache::forSource(source);
        return cache->queue().sync([&] { return cache->load(); });
    }
    static Result<uint64_t> save(LocalAppLibraryCacheSource source,
                                 const std::vector<BundleRecordRef>& records, uint64_t token,
                                 bool bump = false) {
        auto cache = LocalAppLibraryCache::forSource(source);
        return cache->queue().sync([&] { return cache->save(records, token, bump); });
    }
    static uint64_t token(LocalAppLibraryCacheSource source) {
        auto cache = LocalAppLibraryCache::forSource(source);
        return cache->queue().sync([&] { return cache->versionToken(); });
    }
    static Identifiers bundlesOf(const std::vector<BundleRecordRef>& records) {
        Identifiers out;
        for (const auto& r : records) out.push_back(r->bundleIdentifier().value_or("-"));
        return out;
    }

    static constexpr auto kMain = LocalAppLibraryCacheSource::main;
    static constexpr auto kWorkingSet = LocalAppLibraryCacheSource::workingSet;

    TempDir dir;
    ScopedLogCapture log;
    std::shared_ptr<FakeAppRegistry> registry = std::make_shared<FakeAppRegistry>();
    std::shared_ptr<RecordingHostPorterManager> host;

private:
    std::optional<std::string> oldDataHome_;
    std::shared_ptr<AppRegistry> oldRegistry_;
    std::shared_ptr<HostPorterManager> oldHost_;
    std::shared_ptr<AppLibraryLookup> oldLookup_;
};

}  // namespace tamber::testing
