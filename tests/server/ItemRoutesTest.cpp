#include <cctype>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>

#include "tests/server/ServerTest.h"

namespace tamber::testing {
namespace {

namespace fs = std::filesystem;

// Percent-encodes every byte outside the unreserved set.
std::string encoded(const std::string& text) {
    static const char* kHex = "0123456789ABCDEF";
    std::string out;
    for (unsigned char c : text) {
        if (std::isalnum(c) || c == '-' || c == '_' || c == '.' || c == '~' || c == '=') {
            out.push_back(static_cast<char>(c));
        } else {
            out.push_back('%');
            out.push_back(kHex[c >> 4]);
            out.push_back(kHex[c & 15]);
        }
    }
    return out;
}

class ItemRoutesTest : public ServerTest {
protected:
    void write(const std::string& relative, const std::string& text = "x") {
        std::ofstream(storage + "/" + relative) << text;
    }
    std::string children(const std::string& id) { return "/api/v1/containers/" + id + "/children"; }
    std::string item(const std::string& id) { return "/api/v1/items/" + encoded(id); }
};

TEST_F(ItemRoutesTest, ListsAFolderPageByPageWithEveryItemOnce) {
    for (int i = 0; i < 250; ++i) write("box/f" + std::to_string(1000 + i));
    std::string box = idOf("box");
    ASSERT_FALSE(box.empty());

    std::set<std::string> names;
    std::string page;
    int pages = 0;
    do {
        auto result = client()->Get(children(box), httplib::Params{{"page", page}}, {});
        ASSERT_EQ(status(result), 200) << (result ? result->body : "");
        auto json = body(result);
        for (const auto& entry : json["items"]) {
            EXPECT_TRUE(names.insert(entry["filename"].get<std::string>()).second)
                << "listed twice: " << entry["filename"];
            EXPECT_EQ(entry["parentIdentifier"], box);
        }
        page = json["nextPage"].is_null() ? "" : json["nextPage"].get<std::string>();
        if (++pages == 1) {
            EXPECT_EQ(json["items"].size(), 200u);
        }
    } while (!page.empty() && pages < 10);
    EXPECT_EQ(pages, 2);
    EXPECT_EQ(names.size(), 250u);

    EXPECT_EQ(status(client()->Get(children(box) + "?page=%25%25notbase64")), 400);
    EXPECT_EQ(status(client()->Get(children("fid=999999999"))), 404);
}

TEST_F(ItemRoutesTest, ItemsAreFoundByIdentifierPathAndContainerWord) {
    write("box/a.txt", "hello");
    std::string id = idOf("box/a.txt");
    auto byId = body(client()->Get(item(id)));
    EXPECT_EQ(byId["filename"], "a.txt");
    EXPECT_EQ(byId["documentSize"], 5);
    auto looked =
        client()->Get("/api/v1/lookup", httplib::Params{{"path", storage + "/box/a.txt"}}, {});
    EXPECT_EQ(body(looked)["identifier"], id);
    auto path = body(client()->Get(item(id) + "/path"));
    EXPECT_EQ(path["path"], storage + "/box/a.txt");
    EXPECT_EQ(body(client()->Get(item("root") + "/path"))["path"], storage);
    EXPECT_EQ(status(client()->Get(children("root"))), 200);

    EXPECT_EQ(status(client()->Get(item("fid=987654321"))), 404);
    EXPECT_EQ(status(client()->Get(item("did=0"))), 404);
    EXPECT_EQ(status(client()->Get(item("fid=1\x01"))), 404);
    // Outside the published trees nothing is looked up, and no outside path comes back.
    for (const std::string& outside :
         std::vector<std::string>{"/etc/passwd", storage + "/../outside", "relative/x"}) {
        auto refused = client()->Get("/api/v1/lookup", httplib::Params{{"path", outside}}, {});
        EXPECT_TRUE(status(refused) == 404 || status(refused) == 400) << outside;
        auto identifier =
            client()->Get("/api/v1/identifiers", httplib::Params{{"path", outside}}, {});
        EXPECT_TRUE(status(identifier) == 404 || status(identifier) == 400) << outside;
        EXPECT_FALSE(body(identifier).contains("identifier"));
        // The refusal does not repeat a path outside the trees back.
        EXPECT_EQ(refused->body.find(outside), std::string::npos) << refused->body;
        EXPECT_EQ(identifier->body.find(outside), std::string::npos) << identifier->body;
    }
    EXPECT_EQ(status(client()->Get(item("fid=1") + "/path")), 404);
}

TEST_F(ItemRoutesTest, CreatesFoldersAndRefusesBadNames) {
    std::string box = idOf("box");
    auto made = postJson(children(box), {{"folder", "Notes"}});
    ASSERT_EQ(status(made), 200) << made->body;
    EXPECT_EQ(body(made)["filename"], "Notes");
    EXPECT_TRUE(fs::is_directory(storage + "/box/Notes"));

    EXPECT_EQ(status(postJson(children(box), {{"folder", "Notes"}})), 409);
    auto bounced = postJson(children(box), {{"folder", "Notes"}, {"bounce", true}});
    EXPECT_EQ(body(bounced)["filename"], "Notes 2");

    for (const std::string& bad :
         {std::string("a/b"), std::string(".."), std::string("."), std::string("nul\0here", 8),
          std::string(256, 'n'), std::string("")}) {
        EXPECT_EQ(status(postJson(children(box), {{"folder", bad}})), 400) << bad.size();
    }
    std::set<std::string> onDisk;
    for (const auto& entry : fs::directory_iterator(storage + "/box"))
        onDisk.insert(entry.path().filename().string());
    EXPECT_EQ(onDisk, (std::set<std::string>{"Notes", "Notes 2"}));
}

TEST_F(ItemRoutesTest, ImportsACopyAndBouncesATakenName) {
    TempDir outside;
    std::string source = outside.writeFile("report.txt", "data");
    std::string box = idOf("box");
    auto first = postJson(children(box), {{"import", source}});
    ASSERT_EQ(status(first), 200) << first->body;
    auto second = postJson(children(box), {{"import", source}});
    EXPECT_EQ(body(second)["filename"], "report 2.txt");
    EXPECT_TRUE(fs::exists(source));
    EXPECT_EQ(status(postJson(children(box), {{"import", "relative.txt"}})), 400);
    EXPECT_EQ(status(postJson(children(box), {{"import", outside / "missing"}})), 404);
}

TEST_F(ItemRoutesTest, PatchMakesEveryChangeAndAnswersTheFinalItem) {
    fs::create_directory(storage + "/box/dest");
    write("box/a.txt");
    std::string id = idOf("box/a.txt");
    std::string dest = idOf("box/dest");

    auto renamed = patchJson(item(id), {{"filename", "b.txt"}});
    ASSERT_EQ(status(renamed), 200) << renamed->body;
    EXPECT_TRUE(fs::exists(storage + "/box/b.txt"));

    auto moved = patchJson(item(id), {{"parentIdentifier", dest}, {"filename", "c.txt"}});
    ASSERT_EQ(status(moved), 200) << moved->body;
    EXPECT_EQ(body(moved)["parentIdentifier"], dest);
    EXPECT_TRUE(fs::exists(storage + "/box/dest/c.txt"));
    EXPECT_FALSE(fs::exists(storage + "/box/b.txt"));

    auto meta = patchJson(item(id), {{"tags", {"red", "", "blue", "red"}},
                                     {"favoriteRank", 7},
                                     {"lastUsedDate", "2026-01-02T03:04:05Z"}});
    ASSERT_EQ(status(meta), 200) << meta->body;
    auto json = body(meta);
    ASSERT_EQ(json["tags"].size(), 2u) << json.dump();
    EXPECT_EQ(json["favoriteRank"], 7);
    EXPECT_EQ(json["lastUsedDate"], "2026-01-02T03:04:05.000Z");
    auto again = body(client()->Get(item(id)));
    EXPECT_EQ(again["favoriteRank"], 7);

    auto cleared = body(patchJson(
        item(id),
        {{"tags", nlohmann::json::array()}, {"favoriteRank", nullptr}, {"lastUsedDate", nullptr}}));
    EXPECT_TRUE(cleared["tags"].empty());
    EXPECT_TRUE(cleared["favoriteRank"].is_null());
    EXPECT_TRUE(cleared["lastUsedDate"].is_null());

    auto trashed = patchJson(item(id), {{"trashed", true}});
    ASSERT_EQ(status(trashed), 200) << trashed->body;
    EXPECT_EQ(body(trashed)["trashed"], true);
    EXPECT_FALSE(fs::exists(storage + "/box/dest/c.txt"));
    auto back = patchJson(item(body(trashed)["identifier"]), {{"trashed", false}});
    ASSERT_EQ(status(back), 200) << back->body;
    EXPECT_EQ(body(back)["trashed"], false);
    EXPECT_TRUE(fs::exists(storage + "/box/dest/c.txt"));
}

TEST_F(ItemRoutesTest, PatchWithOneBadFieldChangesNothing) {
    write("box/a.txt");
    std::string id = idOf("box/a.txt");
    for (const auto& bad : std::vector<nlohmann::json>{
             {{"filename", "b.txt"}, {"favoriteRank", "high"}},
             {{"filename", "b.txt"}, {"lastUsedDate", "yesterday"}},
             {{"filename", "b.txt"}, {"lastUsedDate", "2026-13-01T00:00:00Z"}},
             {{"filename", "b.txt"}, {"tags", "red"}},
             {{"filename", "b.txt"}, {"trashed", "yes"}},
             {{"filename", "b.txt"}, {"colour", 1}},
             {{"trashed", true}, {"parentIdentifier", "root"}},
             nlohmann::json::object()}) {
        EXPECT_EQ(status(patchJson(item(id), bad)), 400) << bad.dump();
    }
    EXPECT_TRUE(fs::exists(storage + "/box/a.txt"));
    EXPECT_EQ(status(patchJson(item(id), {{"filename", "x/y"}})), 400);
    EXPECT_EQ(status(patchJson(item(id), {{"filename", std::string(300, 'z')}})), 400);
    EXPECT_EQ(status(patchJson(item("fid=987654321"), {{"filename", "z"}})), 404);
    EXPECT_TRUE(fs::exists(storage + "/box/a.txt"));
}

TEST_F(ItemRoutesTest, DeletesForGoodAndPurgesTheTrash) {
    write("box/gone.txt");
    write("box/old.txt");
    std::string gone = idOf("box/gone.txt");
    auto deleted = client()->Delete(item(gone));
    ASSERT_EQ(status(deleted), 200);
    EXPECT_EQ(body(deleted)["deleted"], gone);
    EXPECT_FALSE(fs::exists(storage + "/box/gone.txt"));
    EXPECT_EQ(status(client()->Delete(item(gone))), 404);

    ASSERT_EQ(status(patchJson(item(idOf("box/old.txt")), {{"trashed", true}})), 200);
    EXPECT_EQ(status(client()->Post("/api/v1/trash/purge?olderThan=soon")), 400);
    EXPECT_EQ(status(client()->Post("/api/v1/trash/purge")), 400);
    auto kept = client()->Post("/api/v1/trash/purge?olderThan=30d");
    EXPECT_EQ(body(kept)["removed"], 0);
    auto purged = client()->Post("/api/v1/trash/purge?olderThan=0s");
    EXPECT_EQ(body(purged)["removed"], 1);
}

TEST_F(ItemRoutesTest, ChangesSinceAnAnchorReportAFileWrittenAfterIt) {
    std::string box = idOf("box");
    auto anchor = body(client()->Get("/api/v1/containers/" + box + "/anchor"));
    ASSERT_TRUE(anchor["anchor"].is_string()) << anchor.dump();
    write("box/new.txt");

    // The journal reports the write soon; ask until it does.
    bool seen = false;
    for (int attempt = 0; attempt < 300 && !seen; ++attempt) {
        auto changes = client()->Get("/api/v1/containers/" + box + "/changes",
                                     httplib::Params{{"anchor", anchor["anchor"]}}, {});
        ASSERT_EQ(status(changes), 200) << (changes ? changes->body : "");
        auto batch = body(changes);
        for (const auto& updated : batch["updated"]) seen |= updated["filename"] == "new.txt";
        if (!seen)
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    EXPECT_TRUE(seen);
    EXPECT_EQ(status(client()->Get("/api/v1/containers/" + box + "/changes")), 400);
    EXPECT_EQ(status(client()->Get("/api/v1/containers/" + box + "/changes?anchor=%25%25")), 400);
}

TEST_F(ItemRoutesTest, AppsAnswerTheLibraryList) {
    auto apps = body(client()->Get("/api/v1/apps"));
    EXPECT_TRUE(apps["libraries"].is_array());
    EXPECT_TRUE(apps.contains("versionToken"));
    EXPECT_EQ(body(client()->Post("/api/v1/apps/refresh"))["libraries"], apps["libraries"]);
}

}  // namespace
}  // namespace tamber::testing
