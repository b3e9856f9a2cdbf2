#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <nlohmann/json.hpp>
#include <sstream>

#include "tests/common/CliRunner.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::TempDir;

using testing::CliRun;

CliRun tamber(std::vector<std::string> args) {
    return testing::runTamber(std::move(args));
}

class MetaCommandTest : public ::testing::Test {
protected:
    void SetUp() override {
        storage = dir / "storage";
        file = dir.writeFile("storage/report.txt", "x");
        if (::setxattr(file.c_str(), "user.probe", "1", 1, 0) != 0 && errno == ENOTSUP)
            GTEST_SKIP() << "no user attributes on this file system";
        ::removexattr(file.c_str(), "user.probe");
    }
    json metaJson(std::vector<std::string> extra = {}) {
        std::vector<std::string> args{"--storage", storage, "meta", file, "--json"};
        args.insert(args.end(), extra.begin(), extra.end());
        CliRun r = tamber(args);
        EXPECT_EQ(r.status, 0) << r.out << r.err;
        return json::parse(r.out);
    }

    TempDir dir;
    std::string storage;
    std::string file;
};

TEST_F(MetaCommandTest, FreshFileHasNoMetadata) {
    json j = metaJson();
    EXPECT_TRUE(j["lastUsedDate"].is_null());
    EXPECT_EQ(j["tags"], json::array());
    EXPECT_TRUE(j["favoriteRank"].is_null());
    EXPECT_TRUE(j["trashDate"].is_null());
    EXPECT_TRUE(j["putBack"].is_null());
}

TEST_F(MetaCommandTest, SetValuesAreReadBackAndNoneClearsThem) {
    json j = metaJson({"--set-tags", "Work,Travel plans", "--set-rank", "12", "--set-last-used",
                       "2026-11-23T05:10:12.5Z"});
    EXPECT_EQ(j["tags"], json({"Work", "Travel plans"}));
    EXPECT_EQ(j["favoriteRank"], 12);
    EXPECT_EQ(j["lastUsedDate"], "2026-11-23T05:10:12.500Z");
    // A separate run sees what the first one wrote.
    EXPECT_EQ(metaJson()["tags"], json({"Work", "Travel plans"}));

    j = metaJson({"--set-rank", "none", "--set-last-used", "none", "--set-tags", ""});
    EXPECT_TRUE(j["favoriteRank"].is_null());
    EXPECT_TRUE(j["lastUsedDate"].is_null());
    EXPECT_EQ(j["tags"], json::array());
}

TEST_F(MetaCommandTest, NowIsCloseToTheClock) {
    json j = metaJson({"--set-last-used", "now"});
    ASSERT_TRUE(j["lastUsedDate"].is_string());
    EXPECT_EQ(j["lastUsedDate"].get<std::string>().size(), 24u);
}

TEST_F(MetaCommandTest, ErrorsAreJsonAndExitNonZero) {
    CliRun missing = tamber({"--storage", storage, "meta", dir / "nope", "--json"});
    EXPECT_NE(missing.status, 0);
    json e = json::parse(missing.out)["error"];
    EXPECT_EQ(e["domain"], "HostPlatformErrorDomain");
    EXPECT_EQ(e["code"], 260);
    EXPECT_NE(e["message"].get<std::string>().find("nope"), std::string::npos);

    CliRun badRank = tamber({"--storage", storage, "meta", file, "--json", "--set-rank", "3x"});
    EXPECT_NE(badRank.status, 0);
    EXPECT_EQ(json::parse(badRank.out)["error"]["code"], -1009);
    CliRun badDate = tamber({"--storage", storage, "meta", file, "--set-last-used", "tomorrow"});
    EXPECT_NE(badDate.status, 0);
    EXPECT_NE(badDate.err.find("--set-last-used"), std::string::npos);
    // Nothing was written by the refused calls.
    EXPECT_TRUE(metaJson()["favoriteRank"].is_null());
}

TEST_F(MetaCommandTest, StorageIsCreatedAndMustBeAFolder) {
    std::string fresh = dir / "a/b/Documents";
    CliRun r = tamber({"--storage", fresh, "meta", file});
    EXPECT_EQ(r.status, 0) << r.err;
    struct stat st {};
    EXPECT_EQ(::stat(fresh.c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode));

    CliRun clash = tamber({"--storage", file, "meta", file});
    EXPECT_NE(clash.status, 0);
    EXPECT_NE(clash.err.find("document storage"), std::string::npos);
}

TEST(CommandLineTest, HelpAndVersionSucceedWithoutAVerbError) {
    CliRun help = tamber({"--help"});
    EXPECT_EQ(help.status, 0);
    EXPECT_NE(help.out.find("meta"), std::string::npos);
    CliRun metaHelp = tamber({"meta", "--help"});
    EXPECT_EQ(metaHelp.status, 0);
    EXPECT_NE(metaHelp.out.find("--set-rank"), std::string::npos);
    CliRun version = tamber({"--version"});
    EXPECT_EQ(version.status, 0);
    EXPECT_NE(version.out.find("tamber"), std::string::npos);
    EXPECT_NE(tamber({}).status, 0);
    EXPECT_NE(tamber({"frobnicate"}).status, 0);
}

}  // namespace
}  // namespace tamber
