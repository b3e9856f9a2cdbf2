#include <gtest/gtest.h>

#include <cstdlib>
#include <nlohmann/json.hpp>
#include <set>

#include "platform/tremors/TremorService.h"
#include "tests/common/CliRunner.h"
#include "tests/common/CommandLineTest.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::TempDir;

// The ls, anchor and changes verbs over a fresh storage folder, the real journal and the real
// (empty) application registry.
class ListingCommandsTest : public testing::CommandLineTest {
protected:
    json tamberJson(std::vector<std::string> args, int expectedStatus = 0) {
        args.push_back("--json");
        CliRun run = tamber(std::move(args));
        EXPECT_EQ(run.status, expectedStatus) << run.out << run.err;
        return json::parse(run.out, nullptr, false);
    }
    static std::set<std::string> identifiers(const json& items) {
        std::set<std::string> ids;
        for (const auto& item : items) ids.insert(item["identifier"].get<std::string>());
        return ids;
    }
};

TEST_F(ListingCommandsTest, PagesOf200ResumeFromTheirTokenAndAllListsEverythingOnce) {
    std::string big = dir.makeDir("Documents/Big");
    for (int i = 0; i < 450; ++i) dir.writeFile("Documents/Big/f" + std::to_string(i) + ".txt");
    dir.writeFile("Documents/Big/.hidden");

    std::set<std::string> seen;
    std::vector<size_t> sizes;
    json page = tamberJson({"ls", big});
    for (int guard = 0; guard < 5; ++guard) {
        ASSERT_TRUE(page.contains("items")) << page;
        sizes.push_back(page["items"].size());
        for (const auto& id : identifiers(page["items"])) EXPECT_TRUE(seen.insert(id).second) << id;
        if (page["nextPage"].is_null())
            break;
        page = tamberJson({"ls", big, "--page", page["nextPage"].get<std::string>()});
    }
    EXPECT_EQ(sizes, (std::vector<size_t>{200, 200, 50}));

    json all = tamberJson({"ls", big, "--all"});
    EXPECT_TRUE(all["nextPage"].is_null());
    EXPECT_EQ(identifiers(all["items"]), seen);

    // A token that is not base64 is refused before the provider sees it; one that decodes to
    // anything but a page token makes the browser start over.
    CliRun bad = tamber({"ls", big, "--page", "not base64!"});
    EXPECT_NE(bad.status, 0);
    EXPECT_NE(bad.err.find("--page is not base64"), std::string::npos) << bad.err;
    json expired = tamberJson({"ls", big, "--page", "AAAA"}, 1);
    EXPECT_EQ(expired["error"]["code"], -1002) << expired;
}

TEST_F(ListingCommandsTest, ChangesSinceAnAnchorReportWhatHappenedAndThenNothing) {
    dir.writeFile("Documents/kept.txt", "x");
    std::string doomed = dir.writeFile("Documents/doomed.txt", "x");
    std::string doomedID = tamber({"id", doomed}).out;
    doomedID.erase(doomedID.find_last_not_of('\n') + 1);

    CliRun anchor = tamber({"anchor", "root"});
    ASSERT_EQ(anchor.status, 0) << anchor.err;
    std::string a = anchor.out.substr(0, anchor.out.find('\n'));
    ASSERT_FALSE(a.empty());

    std::string created = dir.writeFile("Documents/created.txt", "new");
    ASSERT_EQ(std::remove(doomed.c_str()), 0);
    json batch = tamberJson({"changes", "root", "--anchor", a});
    ASSERT_TRUE(batch.contains("updated")) << batch;
    EXPECT_FALSE(batch["moreComing"].get<bool>());
    bool sawCreated = false;
    for (const auto& item : batch["updated"]) sawCreated |= item["path"] == created;
    EXPECT_TRUE(sawCreated) << batch;
    std::set<std::string> deleted(batch["deleted"].begin(), batch["deleted"].end());
    EXPECT_TRUE(deleted.contains(doomedID)) << batch;
    // The same changes, in the order they came.
    EXPECT_EQ(batch["changes"].size(), batch["updated"].size() + batch["deleted"].size());

    // From the anchor it handed out, nothing is new.
    json again = tamberJson({"changes", "root", "--anchor", batch["anchor"].get<std::string>()});
    EXPECT_TRUE(again["updated"].empty()) << again;
    EXPECT_TRUE(again["deleted"].empty()) << again;

    json expired = tamberJson({"changes", "root", "--anchor", "AAAA"}, 1);
    EXPECT_EQ(expired["error"]["domain"], "HostPorterErrorDomain");
    EXPECT_EQ(expired["error"]["code"], -1002);
}

}  // namespace
}  // namespace tamber
