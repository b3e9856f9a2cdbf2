#include <gtest/gtest.h>
#include <sys/stat.h>

#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "platform/tremors/TremorService.h"
#include "tests/common/CliRunner.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;

// The id, path and events commands over a fresh storage folder and event journal.
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
    // Replays the journal for `path` (all watched trees without one); one object a line.
    std::vector<json> events(CliRun& run, std::vector<std::string> path = {}) {
        std::vector<std::string> args{"events", "--no-follow", "--json"};
        args.insert(args.end(), path.begin(), path.end());
        run = tamber(args);
        EXPECT_EQ(run.status, 0) << run.err;
        std::vector<json> parsed;
        std::istringstream in(run.out);
        for (std::string l; std::getline(in, l);) parsed.push_back(json::parse(l));
        return parsed;
    }
    static bool shows(const std::vector<json>& events, const std::string& path) {
        for (const auto& e : events)
            if (e["path"] == path)
                return true;
        return false;
    }

    testing::TempDir dir, state;
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
    EXPECT_EQ(line(tamber({"id", file})), fileId) << "the same document keeps its identifier";
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
    CliRun run;
    auto shown = events(run);
    bool historyDone = false;
    for (const auto& j : shown) {
        ASSERT_TRUE(j.contains("id") && j.contains("flags") && j.contains("path") &&
                    j.contains("fileID"));
        historyDone = historyDone || (j["flags"].get<uint32_t>() & 0x10);
    }
    EXPECT_TRUE(shows(shown, file)) << run.out;
    EXPECT_TRUE(historyDone) << run.out;
}

TEST_F(IdentifierCommandsTest, APathOutsideTheWatchedTreesIsWatchedFromThenOnWithAWarning) {
    CliRun run;
    events(run, {storage});  // the journal runs and the storage is watched
    dir.writeFile("Documents/journaled.txt", "x");
    std::string outside = dir.makeDir("Elsewhere");
    auto shown = events(run, {outside});
    EXPECT_NE(run.err.find("tamber: warning: " + outside + " was not in a watched tree"),
              std::string::npos)
        << run.err;
    ASSERT_GE(shown.size(), 2u) << run.out;
    // Watched only after the journal's first events: that history is unknown, and says so.
    EXPECT_NE(shown.front()["flags"].get<uint32_t>() & 0x02, 0u);
    EXPECT_NE(shown.back()["flags"].get<uint32_t>() & 0x10, 0u);
    EXPECT_NE(run.err.find("tamber: warning: events under " + outside + " were lost"),
              std::string::npos)
        << run.err;

    // Watched now, but a replay from 0 still starts before its watch: still told, once.
    std::string file = dir.writeFile("Elsewhere/later.txt", "x");
    shown = events(run, {outside});
    EXPECT_EQ(run.err.find("was not in a watched tree"), std::string::npos) << run.err;
    EXPECT_NE(run.err.find("were lost"), std::string::npos) << run.err;
    EXPECT_TRUE(shows(shown, file)) << run.out;

    std::string missing = dir / "missing";
    run = tamber({"events", "--no-follow", missing});
    EXPECT_NE(run.status, 0);
    EXPECT_NE(run.err.find("can't watch " + missing), std::string::npos) << run.err;
    EXPECT_EQ(run.err.find("warning"), std::string::npos) << run.err;
}

}  // namespace
}  // namespace tamber
