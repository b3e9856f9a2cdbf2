#include <gtest/gtest.h>
#include <sys/stat.h>

#include <nlohmann/json.hpp>
#include <sstream>

#include "platform/tremors/TremorService.h"
#include "tests/common/CliRunner.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::TempDir;

using testing::CliRun;

class IdentifierCommandsTest : public ::testing::Test {
protected:
    void SetUp() override {
        TremorService::resetForTesting();
        TremorService::configure(state.path());
        storage = dir.makeDir("Documents");
    }
    void TearDown() override { TremorService::resetForTesting(); }

    CliRun tamber(std::vector<std::string> args) {
        args.insert(args.begin(), {"--storage", storage});
        return testing::runTamber(std::move(args));
    }
    std::string line(const CliRun& r) {
        EXPECT_EQ(r.status, 0) << r.out << r.err;
        return r.out.substr(0, r.out.find('\n'));
    }

    TempDir dir;
    TempDir state;
    std::string storage;
};

TEST_F(IdentifierCommandsTest, IdentifiersAndPathsRoundTrip) {
    std::string folder = dir.makeDir("Documents/Projects");
    std::string file = dir.writeFile("Documents/Projects/plan.txt", "x");

    EXPECT_EQ(line(tamber({"id", storage})), "HostPorterRootContainerItemIdentifier");
    std::string fileId = line(tamber({"id", file}));
    std::string folderId = line(tamber({"id", folder}));
    EXPECT_EQ(fileId.rfind("did=", 0), 0u);
    EXPECT_EQ(folderId.rfind("fid=", 0), 0u);
    EXPECT_EQ(line(tamber({"path", fileId})), file);
    EXPECT_EQ(line(tamber({"path", folderId})), folder);
    // The same document keeps its identifier on a second run.
    EXPECT_EQ(line(tamber({"id", file})), fileId);

    json j = json::parse(tamber({"path", fileId, "--json"}).out);
    EXPECT_EQ(j["path"], file);
    EXPECT_EQ(j["id"], fileId);
}

TEST_F(IdentifierCommandsTest, BadIdentifiersAndOutsidePathsAreErrors) {
    CliRun bad = tamber({"path", "fid=1=2", "--json"});
    EXPECT_NE(bad.status, 0);
    EXPECT_EQ(json::parse(bad.out)["error"]["domain"], "HostPorterErrorDomain");

    std::string outside = dir.writeFile("elsewhere.txt", "x");
    CliRun id = tamber({"id", outside, "--json"});
    EXPECT_NE(id.status, 0);
    EXPECT_TRUE(json::parse(id.out).contains("error"));

    // A file outside the published folders never resolves, whatever its inode.
    struct stat st {};
    ASSERT_EQ(::stat(outside.c_str(), &st), 0);
    EXPECT_NE(tamber({"path", "fid=" + std::to_string(st.st_ino)}).status, 0);
}

TEST_F(IdentifierCommandsTest, EventsReplayThenStopWithNoFollow) {
    ASSERT_EQ(tamber({"id", storage}).status, 0);  // starts watching the storage folder
    std::string file = dir.writeFile("Documents/new.txt", "x");
    CliRun r = tamber({"events", "--no-follow", "--json"});
    ASSERT_EQ(r.status, 0) << r.err;
    bool sawFile = false, sawHistoryDone = false;
    std::istringstream lines(r.out);
    for (std::string l; std::getline(lines, l);) {
        json j = json::parse(l);
        ASSERT_TRUE(j.contains("id") && j.contains("flags") && j.contains("path") &&
                    j.contains("fileID"));
        sawFile = sawFile || j["path"] == file;
        sawHistoryDone = sawHistoryDone || (j["flags"].get<uint32_t>() & 0x10);
    }
    EXPECT_TRUE(sawFile) << r.out;
    EXPECT_TRUE(sawHistoryDone) << r.out;
}

}  // namespace
}  // namespace tamber
