#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include "platform/strata/StrataService.h"
#include "provider/LocalPorter.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/FakeStrataService.h"

namespace tamber::testing {

// What one completion handler saw, and how often it was called.
struct ItemOutcome {
    int calls = 0;
    LocalItemRef item;
    std::optional<Error> error;

    LocalPorter::ItemCompletion handler() {
        return [this](Result<HostPorterItemRef> received) {
            ++calls;
            // The provider answers with its own records; anything else reads as no item.
            if (received.ok())
                item = std::dynamic_pointer_cast<const LocalItem>(received.value());
            else
                error = received.error();
        };
    }
};

struct ErrorOutcome {
    int calls = 0;
    std::optional<Error> error;

    LocalPorter::ErrorCompletion handler() {
        return [this](Status status) {
            ++calls;
            if (!status.ok())
                error = status.error();
        };
    }
};

// A provider over a storage folder that is itself named "Documents" (as ~/Documents is), one
// app library "com.example.notes" and an in-memory document-ID service. Paths are resolvable
// by identifier once published, as the journal would make them.
class ProviderOperationsTest : public AppLibraryTest {
protected:
    static constexpr const char* kApp = "com.example.notes";
    static constexpr const char* kAppIdentifier = "#com.example.notes";

    void SetUp() override {
        AppLibraryTest::SetUp();
        storage = dir.makeDir("home/Documents");
        host->setStorageURL(Url::fileURLWithPath(storage));
        previousStrata = StrataService::setCurrent(strata);
        install({kApp});
        library = documents(kApp).path();
        porter = LocalPorter::create();
        porter->refreshAppLibraries();
        host->clear();
        log->clear();
    }
    void TearDown() override {
        porter.reset();
        StrataService::setCurrent(previousStrata);
        AppLibraryTest::TearDown();
    }

    // Writes a file (creating its folders) and makes it and its folders resolvable.
    std::string writeFile(const std::string& path, const std::string& contents = "x") {
        std::filesystem::create_directories(std::filesystem::path(path).parent_path());
        std::ofstream(path) << contents;
        publishWithParents(path);
        return path;
    }
    std::string makeFolder(const std::string& path) {
        std::filesystem::create_directories(path);
        publishWithParents(path);
        return path;
    }
    void publishWithParents(const std::string& path) {
        for (std::filesystem::path p = path; p.string().size() > dir.path().size();
             p = p.parent_path())
            strata->publish(p.string());
    }
    HostPorterItemIdentifier identifierOf(const std::string& path) {
        publishWithParents(path);
        auto identifier = porter->persistentIdentifierForItemAtURL(Url::fileURLWithPath(path));
        EXPECT_TRUE(identifier) << path;
        return identifier.value_or("");
    }

    // Every path below the test's folder with each file's contents: what "untouched" compares.
    std::vector<std::string> tree() const {
        std::vector<std::string> entries;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(dir.path())) {
            std::string line = entry.path().string().substr(dir.path().size());
            if (entry.is_regular_file()) {
                std::ifstream in(entry.path());
                line += "=" + std::string(std::istreambuf_iterator<char>(in), {});
            }
            entries.push_back(line);
        }
        std::sort(entries.begin(), entries.end());
        return entries;
    }
    static std::vector<std::string> namesIn(const std::string& folder) {
        std::vector<std::string> names;
        if (!std::filesystem::exists(folder))
            return names;
        for (const auto& entry : std::filesystem::directory_iterator(folder))
            names.push_back(entry.path().filename().string());
        std::sort(names.begin(), names.end());
        return names;
    }
    // Opened sections with exactly this title.
    size_t sectionsTitled(const std::string& title) {
        size_t count = 0;
        for (const auto& line : log->texts())
            count += line.starts_with("[DEBUG] \u250f") && line.ends_with(" " + title);
        return count;
    }
    static void expectNoSuchItem(const std::optional<Error>& error,
                                 const HostPorterItemIdentifier& identifier) {
        ASSERT_TRUE(error);
        EXPECT_EQ(error->domain(), kHostPorterErrorDomain);
        EXPECT_EQ(error->code(), kHostPorterNoSuchItem);
        auto named = error->userInfo().find("itemIdentifier");
        ASSERT_NE(named, error->userInfo().end());
        EXPECT_EQ(named->second, identifier);
    }
    static void expectNoPermission(const std::optional<Error>& error) {
        ASSERT_TRUE(error);
        EXPECT_EQ(error->domain(), kHostPlatformErrorDomain);
        EXPECT_EQ(error->code(), kHostPlatformFileWriteNoPermission);
    }

    std::string storage;
    std::string library;
    std::shared_ptr<FakeStrataService> strata = std::make_shared<FakeStrataService>();
    std::shared_ptr<StrataService> previousStrata;
    std::shared_ptr<LocalPorter> porter;
};

}  // namespace tamber::testing
