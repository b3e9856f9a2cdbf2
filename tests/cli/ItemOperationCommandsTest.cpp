#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>

#include "items/ItemMetadata.h"
#include "platform/imaging/IconBitmap.h"
#include "platform/imaging/ImageEncoder.h"
#include "platform/tremors/TremorService.h"
#include "provider/TrashLocations.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/CliRunner.h"
#include "tests/common/CommandLineTest.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::TempDir;

const char* const kLibrary = "#com.example.Notes";

// A storage folder named Documents and one installed application (a real desktop entry with an
// icon in the user's hicolor theme) whose library is <dir>/container/Documents.
class ItemOperationCommandsTest : public testing::CommandLineTest {
protected:
    void SetUp() override {
        CommandLineTest::SetUp();
        library = dir.makeDir("container/Documents");
        dir.writeFile("applications/com.example.Notes.desktop",
                      "[Desktop Entry]\nType=Application\nName=Notes\nExec=true\n"
                      "Icon=tamber-notes-test\nX-Tamber-Data-Container=" +
                          dir.path() + "/container\nX-Tamber-Supports-Document-Browser=true\n");
    }
    void TearDown() override { CommandLineTest::TearDown(); }

    json tamberJson(std::vector<std::string> args, int expectedStatus = 0) {
        // Verbs run in this one process, one right after the other: let the journal index what
        // the previous verb changed, as it would have before a separate process started.
        if (auto service = TremorService::sharedIfRunning())
            service->sync();
        args.insert(args.begin(), {"--storage", storage});
        args.push_back("--json");
        CliRun run = testing::runTamber(std::move(args));
        EXPECT_EQ(run.status, expectedStatus) << run.out << run.err;
        return json::parse(run.out, nullptr, false);
    }
    // The error a failing verb prints with the exit status given (1: it failed, 2: it was used
    // wrongly, 3: what it names does not exist).
    json errorOf(std::vector<std::string> args, int status = 1) {
        json printed = tamberJson(std::move(args), status);
        EXPECT_TRUE(printed.contains("error")) << printed;
        return printed["error"];
    }

    std::string library;
};

TEST_F(ItemOperationCommandsTest, EveryVerbHasHelp) {
    for (const char* verb : {"import", "mkdir", "rename", "mv", "rm", "trash", "untrash", "tag",
                             "rank", "touch", "thumbnail", "purge-trash"}) {
        CliRun run = testing::runTamber({verb, "--help"});
        EXPECT_EQ(run.status, 0) << verb;
        EXPECT_NE(run.out.find("--json"), std::string::npos) << verb << ": " << run.out;
    }
}

TEST_F(ItemOperationCommandsTest, CreateRenameMoveAndDeleteThroughTheProvider) {
    json work = tamberJson({"mkdir", "Work", kLibrary});
    EXPECT_EQ(work["filename"], "Work");
    EXPECT_EQ(work["parentIdentifier"], kLibrary);
    EXPECT_EQ(work["path"], library + "/Work");
    std::string workId = work["identifier"];

    std::string source = dir.writeFile("outside/todo.txt", "milk");
    json first = tamberJson({"import", source, workId});
    EXPECT_EQ(first["filename"], "todo.txt");
    EXPECT_EQ(first["parentIdentifier"], workId);
    // The parent may be given by path too; the taken name bounces.
    json second = tamberJson({"import", source, library + "/Work"});
    EXPECT_EQ(second["filename"], "todo 2.txt");
    EXPECT_EQ(second["documentSize"], 4);
    EXPECT_TRUE(std::filesystem::exists(source)) << "import copies";

    // What the verbs print is what `item --json` prints.
    json renamed = tamberJson({"rename", second["identifier"], "notes.txt"});
    EXPECT_EQ(renamed["path"], library + "/Work/notes.txt");
    EXPECT_EQ(renamed, tamberJson({"item", renamed["identifier"]}));
    EXPECT_FALSE(std::filesystem::exists(library + "/Work/todo 2.txt"));

    json moved = tamberJson({"mv", library + "/Work/notes.txt", kLibrary, "--name", "moved.txt"});
    EXPECT_EQ(moved["path"], library + "/moved.txt");
    EXPECT_EQ(moved["parentIdentifier"], kLibrary);
    EXPECT_FALSE(std::filesystem::exists(library + "/Work/notes.txt"));

    json deleted = tamberJson({"rm", moved["identifier"]});
    EXPECT_EQ(deleted, (json{{"deleted", moved["identifier"]}}));
    EXPECT_FALSE(std::filesystem::exists(library + "/moved.txt"));
    EXPECT_EQ(tamberJson({"item", moved["identifier"]}, 3)["error"]["domain"], "LocalPorter.Error");
}

TEST_F(ItemOperationCommandsTest, MetadataVerbsShowInTheItemAndClear) {
    std::string file = dir.writeFile("container/Documents/plan.txt", "x");
    std::string id = tamberJson({"item", file})["identifier"];

    EXPECT_EQ(tamberJson({"tag", id, "Work", "Travel"})["tags"], json::array({"Work", "Travel"}));
    EXPECT_EQ(tamberJson({"rank", file, "3"})["favoriteRank"], 3);
    EXPECT_TRUE(tamberJson({"touch", id})["lastUsedDate"].is_string());
    json shown = tamberJson({"item", id});
    EXPECT_EQ(shown["tags"], json::array({"Work", "Travel"}));
    EXPECT_EQ(shown["favoriteRank"], 3);
    EXPECT_TRUE(shown["lastUsedDate"].is_string());

    EXPECT_EQ(tamberJson({"tag", id})["tags"], json::array());
    EXPECT_TRUE(tamberJson({"rank", id, "none"})["favoriteRank"].is_null());
    EXPECT_TRUE(tamberJson({"touch", id, "--clear"})["lastUsedDate"].is_null());
    shown = tamberJson({"item", id});
    EXPECT_EQ(shown["tags"], json::array());
    EXPECT_TRUE(shown["favoriteRank"].is_null());
    EXPECT_TRUE(shown["lastUsedDate"].is_null());

    json badRank = errorOf({"rank", id, "high"}, 2);
    EXPECT_EQ(badRank["domain"], "HostPorterErrorDomain");
    EXPECT_EQ(badRank["code"], -1009);
    // A library is the app's, not a document: it has no last-used date of its own.
    EXPECT_EQ(errorOf({"touch", kLibrary})["code"], -1009);
}

TEST_F(ItemOperationCommandsTest, TrashUntrashAndPurgeByAge) {
    std::string keep = dir.writeFile("container/Documents/keep.txt", "k");
    json trashed = tamberJson({"trash", keep});
    EXPECT_EQ(trashed["trashed"], true);
    EXPECT_EQ(trashed["path"], library + "/.Trash/keep.txt");
    json back = tamberJson({"untrash", trashed["identifier"]});
    EXPECT_EQ(back["trashed"], false);
    EXPECT_EQ(back["path"], keep);

    // Put back into another folder on request.
    std::string folder = dir.makeDir("container/Documents/Elsewhere");
    tamberJson({"trash", keep});
    json elsewhere = tamberJson({"untrash", back["identifier"], "--to", folder});
    EXPECT_EQ(elsewhere["path"], folder + "/keep.txt");

    std::string old = dir.writeFile("container/Documents/old.txt", "o");
    std::string fresh = dir.writeFile("container/Documents/fresh.txt", "f");
    tamberJson({"trash", old});
    tamberJson({"trash", fresh});
    // Trashed forty days ago.
    ASSERT_TRUE(
        ItemMetadata::writeTrashDate(Url::fileURLWithPath(library + "/.Trash/old.txt"),
                                     Date::make(Date::now()->timeIntervalSince1970() - 40 * 86400))
            .ok());

    EXPECT_EQ(tamberJson({"purge-trash", "--older-than", "30d"}), (json{{"removed", 1}}));
    EXPECT_FALSE(std::filesystem::exists(library + "/.Trash/old.txt"));
    EXPECT_TRUE(std::filesystem::exists(library + "/.Trash/fresh.txt"));
    EXPECT_EQ(tamberJson({"purge-trash", "--older-than", "1h"}), (json{{"removed", 0}}));

    for (const char* bad : {"30", "d", "-3d", "12w", "1.5h"})
        EXPECT_EQ(errorOf({"purge-trash", "--older-than", bad}, 2)["code"], -1009) << bad;
    EXPECT_TRUE(std::filesystem::exists(library + "/.Trash/fresh.txt"));
}

TEST_F(ItemOperationCommandsTest, FailuresPrintTheErrorAndTouchNothing) {
    json intoRoot = errorOf({"mkdir", "Nope", "root"});
    EXPECT_EQ(intoRoot["domain"], "HostPlatformErrorDomain");
    EXPECT_EQ(intoRoot["code"], 513);
    EXPECT_TRUE(intoRoot["message"].is_string());
    EXPECT_EQ(errorOf({"mkdir", "Nope", storage})["code"], 513) << "the storage is the root";
    EXPECT_FALSE(std::filesystem::exists(storage + "/Nope"));

    std::string file = dir.writeFile("container/Documents/a.txt", "a");
    for (const auto& args :
         std::vector<std::vector<std::string>>{{"rename", "fid=987654321", "b.txt"},
                                               {"mv", file, "fid=987654321"},
                                               {"trash", "did=987654321"},
                                               {"rm", "did=987654321"},
                                               {"tag", "did=987654321", "Work"},
                                               {"import", file, "fid=987654321"}}) {
        json error = errorOf(args, 3);
        EXPECT_TRUE(error["domain"].is_string()) << args[0];
        EXPECT_TRUE(error["code"].is_number()) << args[0];
    }
    EXPECT_TRUE(std::filesystem::exists(file));
    EXPECT_EQ(errorOf({"untrash", file})["code"].is_number(), true) << "not in the trash";

    // Without --json the error goes to standard error and nothing to standard output.
    CliRun plain = testing::runTamber({"--storage", storage, "mkdir", "Nope", "root"});
    EXPECT_EQ(plain.status, 1);
    EXPECT_TRUE(plain.out.empty()) << plain.out;
    EXPECT_EQ(plain.err, "tamber: mkdir Nope root: no permission to write there\n");
}

TEST_F(ItemOperationCommandsTest, ThumbnailWritesTheAppIconAsPNG) {
    std::string icons = dir.makeDir("icons/hicolor/48x48/apps");
    auto encoded = std::make_shared<Bytes>();
    auto encoder = ImageEncoder::create(encoded, ImageEncoder::kPNGType, 1);
    ASSERT_TRUE(encoder);
    encoder->addImage(Image::make(48, 48, Bytes(48 * 48 * 4, 0x40)));
    ASSERT_TRUE(encoder->finalize());
    std::ofstream(icons + "/tamber-notes-test.png", std::ios::binary)
        .write(reinterpret_cast<const char*>(encoded->data()), encoded->size());

    std::string out = dir / "thumb.png";
    json item = tamberJson({"thumbnail", library, "-o", out});
    EXPECT_EQ(item["identifier"], kLibrary);
    std::ifstream in(out, std::ios::binary);
    Bytes png((std::istreambuf_iterator<char>(in)), {});
    auto decoded = CreateIconFromCachedBitmap(png);
    ASSERT_TRUE(decoded);
    EXPECT_EQ(decoded->width(), 48u);

    // Files have no thumbnail from this provider; nothing is written.
    std::string file = dir.writeFile("container/Documents/a.txt", "a");
    std::string none = dir / "none.png";
    EXPECT_EQ(errorOf({"thumbnail", file, "-o", none})["code"], -1009);
    EXPECT_FALSE(std::filesystem::exists(none));
    EXPECT_EQ(errorOf({"thumbnail", "#com.example.absent", "-o", none}, 3)["domain"],
              "LocalPorter.Error");
}

}  // namespace
}  // namespace tamber
