#include "provider/LocalPorter.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "host/PublishedTrees.h"
#include "platform/FaultInjectingFileSystem.h"
#include "platform/FileContents.h"
#include "platform/LinuxFileSystem.h"
#include "provider/LocalPorterError.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/FakeStrataService.h"
#include "tests/common/ScopedFileSystem.h"

namespace tamber {
namespace {

using namespace testing;

// The fixture's storage and recording host, a fake registry, fresh caches and a porter.
class LocalPorterTest : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        storage = host->documentStorageURL().path();
        previousStrata = StrataService::setCurrent(strata);
        log->clear();
        porter = LocalPorter::create();
        // A new provider asks the host to look at its working set once, and nothing else.
        EXPECT_EQ(host->signals(), std::vector<HostPorterItemIdentifier>{
                                       HostPorterWorkingSetContainerItemIdentifier});
        EXPECT_EQ(log->count("[INFO] auto notify changes on "
                             "HostPorterWorkingSetContainerItemIdentifier at startup",
                             LogLevel::Info),
                  1u);
        host->clear();
    }
    void TearDown() override {
        porter.reset();
        StrataService::setCurrent(previousStrata);
        AppLibraryTest::TearDown();
    }
    size_t signalsFor(const HostPorterItemIdentifier& container) {
        auto signals = host->signals();
        return std::count(signals.begin(), signals.end(), container);
    }
    void expectInvalidIdentifier(const auto& item) {
        ASSERT_FALSE(item.ok());
        EXPECT_EQ(item.error().domain(), kLocalPorterErrorDomain);
        EXPECT_EQ(item.error().code(),
                  static_cast<int64_t>(LocalPorterError::invalidItemIdentifier));
    }

    std::string storage;
    std::shared_ptr<FakeStrataService> strata = std::make_shared<FakeStrataService>();
    std::shared_ptr<StrataService> previousStrata;
    std::shared_ptr<LocalPorter> porter;
};

TEST_F(LocalPorterTest, FailedLookupsGiveInvalidIdentifierAndOneErrorLine) {
    for (const std::string identifier : {"#com.example.absent", "did=4242", "fid=1=2", ""}) {
        log->clear();
        expectInvalidIdentifier(porter->itemForIdentifier(identifier));
        EXPECT_EQ(log->count("[ERROR] item lookup failed for identifier \"" + identifier + "\"",
                             LogLevel::Error),
                  1u);
        // The URL lookups of the same identifier answer nothing, with the host's error.
        auto url = porter->urlForIdentifierLogged(identifier);
        ASSERT_FALSE(url.ok());
        EXPECT_EQ(url.error().code(), kHostPorterNoSuchItem);
        EXPECT_FALSE(porter->URLForItemWithPersistentIdentifier(identifier));
    }
    log->clear();
    std::string missing = storage + "/missing.txt";
    expectInvalidIdentifier(porter->itemForURL(Url::fileURLWithPath(missing)));
    EXPECT_EQ(
        log->count("[ERROR] identifier lookup failed for URL \"" + missing + "\"", LogLevel::Error),
        1u);
}

// Whole lines of one lookup: its numbered section around what it logged.
std::vector<std::string> sectionLines(const std::vector<std::string>& texts,
                                      const std::string& title) {
    for (size_t i = 0; i < texts.size(); ++i) {
        const std::string& open = texts[i];
        if (!open.starts_with("[DEBUG] \u250f") || !open.ends_with(" " + title))
            continue;
        std::string number = open.substr(std::string("[DEBUG] \u250f").size());
        number = number.substr(0, number.size() - title.size() - 1);
        for (size_t j = i + 1; j < texts.size(); ++j) {
            if (texts[j] == "[DEBUG] \u2517" + number)
                return std::vector<std::string>(texts.begin() + i + 1, texts.begin() + j);
        }
    }
    ADD_FAILURE() << "no closed section \"" << title << "\"";
    return {};
}

TEST_F(LocalPorterTest, LookupsRunInTitledSectionsAndLogWhatTheyFound) {
    std::string file = storage + "/a.txt";
    std::ofstream(file) << "x";
    strata->publish(file);
    Url url = Url::fileURLWithPath(file);
    // The app libraries load (and log that) the first time their roots are asked for.
    PublishedTrees::roots();
    log->clear();

    auto identifier = porter->persistentIdentifierForItemAtURL(url);
    ASSERT_TRUE(identifier);
    EXPECT_EQ(sectionLines(log->texts(), "fetching item identifier for \"" + file + "\""),
              std::vector<std::string>{"[DEBUG] found " + *identifier});

    log->clear();
    auto item = porter->itemForIdentifier(*identifier);
    ASSERT_TRUE(item.ok());
    EXPECT_EQ(sectionLines(log->texts(), "fetching item's properties for \"" + *identifier + "\""),
              std::vector<std::string>{"[DEBUG] found " + item.value()->description()});

    log->clear();
    auto found = porter->URLForItemWithPersistentIdentifier(*identifier);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->path(), file);
    EXPECT_EQ(sectionLines(log->texts(), "fetching URL for \"" + *identifier + "\""),
              std::vector<std::string>{"[DEBUG] found " + found->absoluteString()});

    // A failure is logged after its section has closed, with the host error's code.
    log->clear();
    EXPECT_FALSE(porter->URLForItemWithPersistentIdentifier("#com.example.absent"));
    EXPECT_TRUE(sectionLines(log->texts(), "fetching URL for \"#com.example.absent\"").empty());
    EXPECT_EQ(log->texts().back(),
              "[ERROR] can't find URL matching identifier "
              "#com.example.absent; " +
                  std::to_string(kHostPorterNoSuchItem));
}

TEST_F(LocalPorterTest, FilesAreLocalSoProvidingDoesNothing) {
    std::string file = storage + "/missing.txt";
    Url url = Url::fileURLWithPath(file);
    log->clear();
    int calls = 0;
    auto completion = [&](std::optional<Error> error) {
        ++calls;
        EXPECT_FALSE(error);
    };
    porter->providePlaceholderAtURL(url, completion);
    EXPECT_EQ(calls, 1);  // at once, on the caller's thread
    porter->startProvidingItemAtURL(url, completion);
    EXPECT_EQ(calls, 2);
    porter->itemChangedAtURL(url);
    porter->stopProvidingItemAtURL(url);
    EXPECT_FALSE(std::filesystem::exists(file));
    EXPECT_TRUE(std::filesystem::is_empty(storage));
    EXPECT_TRUE(log->texts().empty());
}

TEST_F(LocalPorterTest, TemporaryLocalFolderIsCreatedOnDemand) {
    std::string folder = storage + "/.TemporaryLocalFolder";
    ASSERT_FALSE(std::filesystem::exists(folder));
    for (int attempt = 0; attempt < 2; ++attempt) {
        auto item = porter->itemForIdentifierLogged(HostPorterTemporaryLocalFolderItemIdentifier);
        ASSERT_TRUE(item.ok()) << item.error().description();
        EXPECT_EQ(item.value()->fileURL().path(), folder);
        EXPECT_TRUE(std::filesystem::is_directory(folder));
    }

    std::filesystem::remove(folder);
    auto faults = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    faults->inject(FaultInjectingFileSystem::Operation::Mkdir, EACCES, -1, ".TemporaryLocalFolder");
    ScopedFileSystem scoped(faults);
    log->clear();
    expectInvalidIdentifier(
        porter->itemForIdentifier(HostPorterTemporaryLocalFolderItemIdentifier));
    EXPECT_EQ(log->countStartingWith("[ERROR] can't create temporary directory; "), 1u);
}

// A provider handed its own manager signals that one, not the process default: two runtimes'
// hosts must not see each other's provider.
TEST_F(LocalPorterTest, AProviderGivenAManagerSignalsThatManager) {
    auto given =
        std::make_shared<RecordingHostPorterManager>(Url::fileURLWithPath(dir.makeDir("given")));
    auto own = LocalPorter::create({given, &FileSystem::current()});
    EXPECT_EQ(given->signals(),
              std::vector<HostPorterItemIdentifier>{HostPorterWorkingSetContainerItemIdentifier});
    EXPECT_TRUE(host->signals().empty());
}

TEST_F(LocalPorterTest, AppLibraryDocumentsFolderIsItsHashIdentifier) {
    install({"com.example.notes"});
    porter->refreshAppLibraries();
    Url library = documents("com.example.notes");

    EXPECT_EQ(porter->persistentIdentifierForItemAtURL(library), "#com.example.notes");
    auto viaURL = porter->itemForURL(library);
    ASSERT_TRUE(viaURL.ok());
    EXPECT_EQ(viaURL.value()->itemIdentifier(), "#com.example.notes");
    auto viaIdentifier = porter->itemForIdentifierLogged("#com.example.notes");
    ASSERT_TRUE(viaIdentifier.ok());
    EXPECT_EQ(viaIdentifier.value()->fileURL(), library);

    // Any other folder named "Documents" (a user's, or the storage itself) is an ordinary item.
    Url folder = Url::fileURLWithPath(storage + "/Documents");
    ASSERT_TRUE(FileContents::createDirectory(folder).ok());
    auto plain = porter->persistentIdentifierForItemAtURL(folder);
    ASSERT_TRUE(plain);
    EXPECT_EQ(plain->rfind("fid=", 0), 0u) << *plain;
    EXPECT_EQ(log->countStartingWith("[ERROR]"), 0u);
}

TEST_F(LocalPorterTest, RefreshSignalsOnlyTheContainersThatChanged) {
    install({"com.example.one"});
    porter->refreshAppLibraries();
    EXPECT_EQ(signalsFor(HostPorterRootContainerItemIdentifier), 1u);
    EXPECT_EQ(signalsFor(HostPorterWorkingSetContainerItemIdentifier), 1u);

    auto unchanged = porter->refreshAppLibraries();
    EXPECT_FALSE(unchanged.rootChanged || unchanged.workingSetChanged);
    EXPECT_EQ(signalsFor(HostPorterRootContainerItemIdentifier), 1u);
    EXPECT_EQ(signalsFor(HostPorterWorkingSetContainerItemIdentifier), 1u);
}

TEST_F(LocalPorterTest, BurstOfRefreshRequestsRunsOneRefreshAndCallsEveryHandler) {
    install({"com.example.one"});
    porter->refreshAppLibraries();
    log->clear();
    std::atomic<int> called{0};
    for (int i = 0; i < 10; ++i)
        porter->_refreshInstalledAppsWithCompletionHandler([&] { ++called; });
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (called < 10 && std::chrono::steady_clock::now() < deadline)
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    porter->appRefreshQueue()->sync([] {});
    EXPECT_EQ(called, 10);
    size_t sections = 0;
    for (const auto& text : log->texts()) sections += text.ends_with(" pacer event");
    EXPECT_EQ(sections, 1u);
}

}  // namespace
}  // namespace tamber
