#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <filesystem>
#include <nlohmann/json.hpp>

#include "tests/common/CliRunner.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::TempDir;

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

TEST_F(MetaCommandTest, SetValuesAreReadBackAndNoneClearsThem) {
    auto expectCleared = [](const json& j) {
        EXPECT_TRUE(j["lastUsedDate"].is_null());
        EXPECT_EQ(j["tags"], json::array());
        EXPECT_TRUE(j["favoriteRank"].is_null());
    };
    json fresh = metaJson();
    expectCleared(fresh);
    EXPECT_TRUE(fresh["trashDate"].is_null());
    EXPECT_TRUE(fresh["putBack"].is_null());

    json j = metaJson({"--set-tags", "Work,Travel plans", "--set-rank", "12", "--set-last-used",
                       "2026-11-23T05:10:12.5Z"});
    EXPECT_EQ(j["tags"], json({"Work", "Travel plans"}));
    EXPECT_EQ(j["favoriteRank"], 12);
    EXPECT_EQ(j["lastUsedDate"], "2026-11-23T05:10:12.500Z");
    EXPECT_EQ(metaJson()["tags"], json({"Work", "Travel plans"})) << "a separate run sees it";
    expectCleared(metaJson({"--set-rank", "none", "--set-last-used", "none", "--set-tags", ""}));
    EXPECT_EQ(metaJson({"--set-last-used", "now"})["lastUsedDate"].get<std::string>().size(), 24u);
}

TEST_F(MetaCommandTest, ErrorsAreJsonAndExitNonZero) {
    CliRun missing = tamber({"--storage", storage, "meta", dir / "storage/nope", "--json"});
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

// One bad value among good ones refuses the whole call: the values before it in the
// command line are not written either.
TEST_F(MetaCommandTest, ABadValueLeavesTheOthersUnwritten) {
    CliRun mixed = tamber({"--storage", storage, "meta", file, "--json", "--set-rank", "4",
                           "--set-tags", "Work", "--set-last-used", "tomorrow"});
    EXPECT_EQ(mixed.status, 2) << mixed.out << mixed.err;
    json after = metaJson();
    EXPECT_TRUE(after["favoriteRank"].is_null()) << after.dump();
    EXPECT_TRUE(after["lastUsedDate"].is_null()) << after.dump();
    EXPECT_EQ(after["tags"], json::array());
}

TEST_F(MetaCommandTest, StorageIsCreatedAndMustBeAFolder) {
    std::string fresh = dir / "a/b/Documents";
    CliRun r = tamber({"--storage", fresh, "meta", fresh});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_TRUE(std::filesystem::is_directory(fresh));

    CliRun clash = tamber({"--storage", file, "meta", file});
    EXPECT_NE(clash.status, 0);
    EXPECT_NE(clash.err.find("document storage"), std::string::npos);
}

TEST(CommandLineTest, HelpAndVersionSucceedAndAMissingOrUnknownVerbFails) {
    for (auto args : {std::vector<std::string>{"--help"}, {"meta", "--help"}, {"--version"}})
        EXPECT_EQ(tamber(args).status, 0) << args[0];
    EXPECT_NE(tamber({}).status, 0);
    EXPECT_NE(tamber({"frobnicate"}).status, 0);
}

}  // namespace
}  // namespace tamber
