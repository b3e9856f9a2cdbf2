#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <filesystem>
#include <fstream>
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

constexpr const char* kTagsAttribute = "user.com.velk.metadata:_kHostItemUserTags";
constexpr const char* kRankAttribute = "user.com.velk.favorite-rank.number#PS";

// Metadata set through Tamber stays with the document when another program replaces the file, as
// `sed -i` and most editors do, whether or not a Tamber process runs meanwhile.
class DocumentMetadataCommandsTest : public ::testing::Test {
protected:
    void SetUp() override {
        TremorService::resetForTesting();
        TremorService::configure(state.path());
        storage = dir.makeDir("Documents");
        file = dir.writeFile("Documents/notes.txt", "a line\n");
        if (::setxattr(file.c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
        ::removexattr(file.c_str(), "user.probe");
    }
    void TearDown() override { TremorService::resetForTesting(); }

    CliRun tamber(std::vector<std::string> args) {
        // Verbs run in this one process, one right after the other: let the journal take in
        // what happened before, as it would have before a separate process started.
        if (auto service = TremorService::sharedIfRunning())
            service->sync();
        args.insert(args.begin(), {"--storage", storage});
        CliRun run = testing::runTamber(std::move(args));
        EXPECT_EQ(run.status, 0) << run.out << run.err;
        return run;
    }
    std::string id() {
        std::string out = tamber({"id", file}).out;
        return out.substr(0, out.find('\n'));
    }
    json tags() { return json::parse(tamber({"meta", file, "--json"}).out)["tags"]; }
    // What a separate Tamber process ending looks like to the next one.
    static void endProcess() { TremorService::resetForTesting(); }

    // What `sed -i s/a/b/ FILE` does: a new file next to it, renamed over it.
    void replaceLikeSed(const std::string& path) {
        std::string text;
        {
            std::ifstream in(path, std::ios::binary);
            text.assign(std::istreambuf_iterator<char>(in), {});
        }
        for (char& c : text)
            if (c == 'a')
                c = 'b';
        std::string temporary = std::filesystem::path(path).parent_path() / "sedX1b2c3";
        std::ofstream(temporary, std::ios::binary) << text;
        std::filesystem::rename(temporary, path);
    }

    testing::TempDir dir, state;
    std::string storage;
    std::string file;
};

TEST_F(DocumentMetadataCommandsTest, TagsSurviveAReplaceWhileNothingRuns) {
    tamber({"tag", file, "Home", "Work"});
    std::string before = id();
    endProcess();
    replaceLikeSed(file);
    EXPECT_EQ(tags(), json({"Home", "Work"}));
    EXPECT_EQ(id(), before);
    // Written back to the file itself, so every reader sees them.
    EXPECT_GT(::getxattr(file.c_str(), kTagsAttribute, nullptr, 0), 0);
}

TEST_F(DocumentMetadataCommandsTest, TagsAndRankSurviveAReplaceWhileTheJournalRuns) {
    tamber({"tag", file, "Home"});
    tamber({"rank", file, "4"});
    std::string before = id();
    replaceLikeSed(file);
    replaceLikeSed(file);  // twice: the second file may get the first one's inode number
    EXPECT_EQ(id(), before);
    EXPECT_EQ(tags(), json({"Home"}));
    EXPECT_EQ(json::parse(tamber({"meta", file, "--json"}).out)["favoriteRank"], 4);
}

// Tags are shared with desktop programs through user.xdg.tags: the verbs show a list another
// program wrote, and the list and the tags stay together through a replace.
TEST_F(DocumentMetadataCommandsTest, ADesktopTagListShowsInMetaAndSurvivesAReplace) {
    auto desktopList = [&]() -> std::string {
        char buffer[256];
        ssize_t n = ::getxattr(file.c_str(), "user.xdg.tags", buffer, sizeof buffer);
        return n < 0 ? std::string("(none)") : std::string(buffer, static_cast<size_t>(n));
    };
    tamber({"tag", file, "Home", "Work"});
    EXPECT_EQ(desktopList(), "Home,Work");

    const std::string theirs = "Work, Desk";
    ASSERT_EQ(::setxattr(file.c_str(), "user.xdg.tags", theirs.data(), theirs.size(), 0), 0);
    EXPECT_EQ(tags(), json({"Work", "Desk"}));
    replaceLikeSed(file);
    EXPECT_EQ(tags(), json({"Work", "Desk"}));
    EXPECT_EQ(desktopList(), theirs);

    tamber({"tag", file});
    EXPECT_EQ(tags(), json::array());
    EXPECT_EQ(desktopList(), "(none)");
}

// Removed by the user on the file itself (not through Tamber): the removal is the user's word,
// and the next replacement must not bring the value back; what was not removed still comes back.
TEST_F(DocumentMetadataCommandsTest, AnAttributeRemovedOnTheFileStaysRemovedAfterAReplace) {
    for (bool running : {true, false}) {
        SCOPED_TRACE(running ? "journal running" : "nothing running");
        tamber({"tag", file, "Home"});
        tamber({"rank", file, "4"});
        if (!running)
            endProcess();
        ASSERT_EQ(::removexattr(file.c_str(), kRankAttribute), 0);
        if (running) {
            // The journal takes the removal in before the replacement: a removal that a save
            // overtakes before it is read cannot be told from a value the save dropped.
            if (auto service = TremorService::sharedIfRunning())
                service->sync();
        } else {
            // Seen by the next start: the same file, with another change time.
            id();
            endProcess();
        }
        replaceLikeSed(file);
        json meta = json::parse(tamber({"meta", file, "--json"}).out);
        EXPECT_EQ(meta["tags"], json({"Home"}));
        EXPECT_TRUE(meta["favoriteRank"].is_null()) << meta.dump();
    }
}

}  // namespace
}  // namespace tamber
