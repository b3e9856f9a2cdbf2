#include <gtest/gtest.h>

#include <cstdlib>
#include <nlohmann/json.hpp>

#include "platform/tremors/TremorService.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/CliRunner.h"
#include "tests/common/CommandLineTest.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::TempDir;

// One installed application, described by a real desktop entry, whose library is
// <dir>/container/Documents.
class ItemAndAppsCommandTest : public testing::CommandLineTest {
protected:
    void SetUp() override {
        CommandLineTest::SetUp();
        library = dir.makeDir("container/Documents");
        dir.writeFile("applications/com.example.Notes.desktop",
                      "[Desktop Entry]\nType=Application\nName=Notes\nExec=true\n"
                      "X-Tamber-Data-Container=" +
                          dir.path() + "/container\nX-Tamber-Supports-Document-Browser=true\n");
    }
    void TearDown() override { CommandLineTest::TearDown(); }

    json tamberJson(std::vector<std::string> args, int expectedStatus = 0) {
        args.insert(args.begin(), {"--storage", storage});
        args.push_back("--json");
        CliRun run = testing::runTamber(std::move(args));
        EXPECT_EQ(run.status, expectedStatus) << run.out << run.err;
        return json::parse(run.out, nullptr, false);
    }

    std::string library;
};

TEST_F(ItemAndAppsCommandTest, InstalledAppIsListedAndItsFilesResolve) {
    json listed = {{"versionToken", 1},
                   {"libraries", json::array({json{{"identifier", "#com.example.Notes"},
                                                   {"bundleIdentifier", "com.example.Notes"},
                                                   {"name", "Notes"},
                                                   {"root", library}}})}};
    EXPECT_EQ(tamberJson({"apps", "--refresh"}), listed);
    EXPECT_EQ(tamberJson({"apps"}), listed) << "nothing changed: the list keeps its version";

    json libraryItem = tamberJson({"item", "#com.example.Notes"});
    EXPECT_EQ(libraryItem["parentIdentifier"], "HostPorterRootContainerItemIdentifier");
    EXPECT_EQ(libraryItem["filename"], "Notes");
    EXPECT_EQ(libraryItem["path"], library);
    EXPECT_EQ(libraryItem["capabilities"], 0x03);

    std::string note = dir.writeFile("container/Documents/todo.txt", "milk");
    json byPath = tamberJson({"item", note});
    std::string identifier = byPath["identifier"];
    EXPECT_EQ(identifier.rfind("did=", 0), 0u);
    EXPECT_EQ(byPath["parentIdentifier"], "#com.example.Notes");
    EXPECT_EQ(byPath["documentSize"], 4);
    EXPECT_EQ(byPath["capabilities"], 0x3F);
    EXPECT_EQ(tamberJson({"item", identifier})["path"], note);
}

TEST_F(ItemAndAppsCommandTest, TheStorageFolderNamedDocumentsIsTheRootByPath) {
    json byPath = tamberJson({"item", storage});
    EXPECT_EQ(byPath["identifier"], "HostPorterRootContainerItemIdentifier");
    EXPECT_EQ(byPath["capabilities"], 0x01);
    EXPECT_EQ(byPath, tamberJson({"item", "root"}));
    // Any other folder of that name that is no app library is an ordinary folder.
    std::string nested = dir.makeDir("Documents/Work/Documents");
    json plain = tamberJson({"item", nested});
    EXPECT_EQ(plain["filename"], "Documents");
    EXPECT_EQ(plain["identifier"].get<std::string>().rfind("fid=", 0), 0u) << plain;
}

TEST_F(ItemAndAppsCommandTest, UnknownItemsAreErrors) {
    json error = tamberJson({"item", "#com.example.absent"}, 3)["error"];
    EXPECT_EQ(error["domain"], "LocalPorter.Error");
    EXPECT_EQ(error["code"], 0);
    // A file outside every published tree is refused as such.
    json outside = tamberJson({"item", dir.writeFile("elsewhere.txt")}, 1)["error"];
    EXPECT_EQ(outside["domain"], "HostPorterErrorDomain");
    EXPECT_EQ(outside["code"], -1005);
    EXPECT_EQ(outside["message"], "not inside the document storage or an app library");
}

TEST_F(ItemAndAppsCommandTest, RemovedAppLeavesTheListAndBumpsTheToken) {
    ASSERT_EQ(tamberJson({"apps"})["libraries"].size(), 1u);
    std::remove((dir / "applications/com.example.Notes.desktop").c_str());
    EXPECT_EQ(tamberJson({"apps", "--refresh"}),
              (json{{"versionToken", 2}, {"libraries", json::array()}}));
    EXPECT_EQ(tamberJson({"item", "#com.example.Notes"}, 3)["error"]["code"], 0);
}

}  // namespace
}  // namespace tamber
