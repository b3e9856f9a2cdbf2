#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "platform/tremors/TremorService.h"
#include "tests/common/CliRunner.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;

// What the journal publishes from one run to the next: each run is a fresh service, as each
// `tamber` process is.
class JournalRootsCommandsTest : public ::testing::Test {
protected:
    void SetUp() override {
        TremorService::resetForTesting();
        TremorService::configure(state.path());
        first = dir.makeDir("First");
        second = dir.makeDir("Second");
        file = dir.writeFile("First/Folder/file.txt", "x");
    }
    void TearDown() override { TremorService::resetForTesting(); }

    CliRun run(const std::string& storage, std::vector<std::string> args) {
        TremorService::resetForTesting();  // a new process
        args.insert(args.begin(), {"--storage", storage});
        return testing::runTamber(std::move(args));
    }
    std::string identifierOf(const std::string& storage, const std::string& path) {
        CliRun r = run(storage, {"id", path});
        EXPECT_EQ(r.status, 0) << r.err;
        return r.out.substr(0, r.out.find('\n'));
    }

    testing::TempDir dir, state;
    std::string first, second, file;
};

TEST_F(JournalRootsCommandsTest, AnEarlierStorageFolderAnswersNoIdentifierUntilPublishedAgain) {
    std::string fileId = identifierOf(first, file);
    std::string folderId = identifierOf(first, first + "/Folder");
    ASSERT_EQ(fileId.rfind("did=", 0), 0u) << fileId;
    ASSERT_EQ(folderId.rfind("fid=", 0), 0u) << folderId;

    for (const auto& id : {fileId, folderId}) {
        CliRun r = run(second, {"path", id});
        EXPECT_NE(r.status, 0) << id << " resolved into an unpublished tree: " << r.out;
        EXPECT_EQ(r.out.find(first), std::string::npos) << r.out;
    }
    CliRun again = run(first, {"path", fileId});
    EXPECT_EQ(again.status, 0) << again.err;
    EXPECT_EQ(again.out, file + "\n");
}

TEST_F(JournalRootsCommandsTest, ForgetDropsARememberedTreeOnceAndSaysWhatItDropped) {
    std::string fileId = identifierOf(first, file);
    ASSERT_EQ(fileId.rfind("did=", 0), 0u) << fileId;

    CliRun forgot = run(second, {"events", "--forget", first + "/", "--json"});
    ASSERT_EQ(forgot.status, 0) << forgot.out << forgot.err;
    json j = json::parse(forgot.out);
    EXPECT_EQ(j["forgotten"], first);
    EXPECT_EQ(j["entries"], 2);  // Folder and Folder/file.txt
    EXPECT_EQ(j["documents"], 1);

    CliRun again = run(second, {"events", "--forget", first});
    EXPECT_NE(again.status, 0);
    EXPECT_NE(again.err.find(first + " is not a remembered tree"), std::string::npos) << again.err;
    EXPECT_EQ(again.out, "");
    CliRun never = run(second, {"events", "--forget", dir / "Never"});
    EXPECT_NE(never.status, 0);
    EXPECT_NE(never.err.find("is not a remembered tree"), std::string::npos) << never.err;

    // Published again, the tree is indexed anew; the forgotten document ID stays gone.
    CliRun path = run(first, {"path", fileId});
    EXPECT_NE(path.status, 0) << path.out;
    std::string newId = identifierOf(first, file);
    EXPECT_EQ(newId.rfind("did=", 0), 0u) << newId;
    EXPECT_NE(newId, fileId);
}

}  // namespace
}  // namespace tamber
