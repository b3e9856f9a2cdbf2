#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <nlohmann/json.hpp>

#include "host/StagingCopies.h"
#include "platform/tremors/TremorService.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/common/CliRunner.h"
#include "tests/common/CommandLineTest.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;
using nlohmann::json;
using testing::CliRun;
using testing::TempDir;

const char* const kNotesLibrary = "#com.example.Notes";
const char* const kOutside = "not inside the document storage or an app library";

// A storage folder with a folder "Shelf", one app library, and a folder "elsewhere" outside
// both, which symbolic links inside the trees point to.
class BoundaryCommandsTest : public testing::CommandLineTest {
protected:
    void SetUp() override {
        CommandLineTest::SetUp();
        previousLedger_ = StagingCopies::setLedgerDirectoryForTesting(state / "ledger");
        inbox = dir.makeDir("Documents/Shelf");
        elsewhere = dir.makeDir("elsewhere");
        library = dir.makeDir("container/Documents");
        dir.writeFile("applications/com.example.Notes.desktop",
                      "[Desktop Entry]\nType=Application\nName=Notes\nExec=true\n"
                      "X-Tamber-Data-Container=" +
                          dir.path() + "/container\nX-Tamber-Supports-Document-Browser=true\n");
    }
    void TearDown() override {
        StagingCopies::setLedgerDirectoryForTesting(previousLedger_);
        CommandLineTest::TearDown();
    }

    json tamberJson(std::vector<std::string> args, int expectedStatus = 0) {
        if (auto service = TremorService::sharedIfRunning())
            service->sync();
        args.insert(args.begin(), {"--storage", storage});
        args.push_back("--json");
        CliRun run = testing::runTamber(std::move(args));
        EXPECT_EQ(run.status, expectedStatus) << run.out << run.err;
        return json::parse(run.out, nullptr, false);
    }
    json errorOf(std::vector<std::string> args) {
        json printed = tamberJson(std::move(args), 1);
        EXPECT_TRUE(printed.contains("error")) << printed;
        return printed["error"];
    }
    // The link `name` in the inbox, pointing at the outside folder.
    std::string escape(const std::string& name = "esc") {
        std::string link = inbox + "/" + name;
        fs::create_directory_symlink(elsewhere, link);
        return link;
    }
    bool elsewhereIsEmpty() const { return fs::is_empty(elsewhere); }
    static uint64_t inodeOf(const std::string& path) {
        struct stat st {};
        EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
        return st.st_ino;
    }

    std::string previousLedger_;
    std::string inbox, elsewhere, library;
};

TEST_F(BoundaryCommandsTest, NothingIsCreatedOrShownThroughALinkToOutside) {
    std::string esc = escape();
    json made = errorOf({"mkdir", "NEW", esc});
    EXPECT_EQ(made["message"], kOutside);
    EXPECT_FALSE(fs::exists(elsewhere + "/NEW"));

    // A folder made outside by someone else is still not an item.
    fs::create_directory(elsewhere + "/NEW");
    EXPECT_EQ(errorOf({"item", esc + "/NEW"})["message"], kOutside);
    EXPECT_EQ(errorOf({"id", esc + "/NEW"})["message"], kOutside);
    EXPECT_EQ(errorOf({"ls", esc + "/NEW"})["message"], kOutside);
    // The link itself is an item of the inbox, but not a container to list.
    EXPECT_EQ(errorOf({"ls", esc})["message"], kOutside);
    json link = tamberJson({"item", esc});
    EXPECT_EQ(link["filename"], "esc");
    EXPECT_EQ(link["path"], esc);
}

TEST_F(BoundaryCommandsTest, MovesAndImportsIntoALinkLeaveTheSourceInPlace) {
    std::string esc = escape();
    std::string file = dir.writeFile("Documents/Shelf/a.txt", "a");
    std::string id = tamberJson({"item", file})["identifier"];

    EXPECT_EQ(errorOf({"mv", id, esc})["message"], kOutside);
    EXPECT_EQ(errorOf({"mv", id, "fid=" + std::to_string(inodeOf(esc))})["message"], kOutside);
    EXPECT_EQ(errorOf({"mv", id, esc + "/"})["message"], kOutside);
    EXPECT_TRUE(fs::exists(file));

    std::string source = dir.writeFile("outside/b.txt", "b");
    EXPECT_EQ(errorOf({"import", source, esc})["message"], kOutside);
    EXPECT_TRUE(fs::exists(source));
    EXPECT_TRUE(elsewhereIsEmpty());
}

TEST_F(BoundaryCommandsTest, ItemsOutsideCannotBeActedOn) {
    std::string outside = dir.writeFile("outside/c.txt", "c");
    for (const auto& args :
         std::vector<std::vector<std::string>>{{"rename", outside, "d.txt"},
                                               {"mv", outside, inbox},
                                               {"rm", outside},
                                               {"trash", outside},
                                               {"rank", outside, "3"},
                                               {"import", outside, dir.path() + "/outside"},
                                               {"mkdir", "X", dir.path() + "/outside"}}) {
        EXPECT_EQ(errorOf(args)["message"], kOutside) << args[0];
    }
    EXPECT_TRUE(fs::exists(outside));
    EXPECT_FALSE(fs::exists(dir.path() + "/outside/X"));
    EXPECT_FALSE(fs::exists(inbox + "/c.txt"));
}

TEST_F(BoundaryCommandsTest, MetaRefusesPathsOutsideAndWritesNothing) {
    std::string outside = dir.writeFile("outside/meta.txt", "m");
    json error = errorOf({"meta", outside, "--set-rank", "3"});
    EXPECT_EQ(error["message"], kOutside);
    char value[64];
    EXPECT_LT(
        ::getxattr(outside.c_str(), "user.com.velk.favorite-rank.number#PS", value, sizeof value),
        0);
    EXPECT_EQ(errorOf({"meta", outside})["message"], kOutside);

    // Through a link inside the storage too.
    std::string esc = escape();
    dir.writeFile("elsewhere/x.txt", "x");
    EXPECT_EQ(errorOf({"meta", esc + "/x.txt", "--set-rank", "1"})["message"], kOutside);
    EXPECT_LT(::getxattr((elsewhere + "/x.txt").c_str(), "user.com.velk.favorite-rank.number#PS",
                         value, sizeof value),
              0);

    std::string inside = dir.writeFile("Documents/Shelf/in.txt", "i");
    EXPECT_EQ(tamberJson({"meta", inside, "--set-rank", "2"})["favoriteRank"], 2);
    // An app library is published too.
    tamberJson({"apps"});
    std::string inLibrary = dir.writeFile("container/Documents/lib.txt", "l");
    EXPECT_EQ(tamberJson({"meta", inLibrary, "--set-rank", "4"})["favoriteRank"], 4);
}

TEST_F(BoundaryCommandsTest, ALinkedTrashReceivesNothing) {
    fs::create_directory_symlink(elsewhere, library + "/.Trash");
    std::string file = dir.writeFile("container/Documents/t.txt", "t");
    json error = errorOf({"trash", file});
    EXPECT_EQ(error["message"], kOutside);
    EXPECT_TRUE(fs::exists(file));
    EXPECT_TRUE(elsewhereIsEmpty());
}

TEST_F(BoundaryCommandsTest, ALinkedTrashIsNeitherReadNorWrittenByThePurge) {
    fs::create_directory_symlink(elsewhere, library + "/.Trash");
    std::string undated = dir.writeFile("elsewhere/old.txt", "o");
    EXPECT_EQ(tamberJson({"purge-trash", "--older-than", "1s"}), (json{{"removed", 0}}));
    EXPECT_TRUE(fs::exists(undated));
    // An undated item in a real trash would have been stamped with today's date.
    EXPECT_EQ(::listxattr(undated.c_str(), nullptr, 0), 0);
}

TEST_F(BoundaryCommandsTest, AVerbSweepsTheStagingCopiesOfAKilledImport) {
    pid_t child = ::fork();
    if (child == 0)
        ::_exit(0);
    ASSERT_GT(child, 0);
    ::waitpid(child, nullptr, 0);
    std::string staged = dir.makeDir("Documents/Shelf/.tamber-import-" + std::to_string(child) +
                                     "-0123456789abcdef");
    dir.writeFile(
        "Documents/Shelf/.tamber-import-" + std::to_string(child) + "-0123456789abcdef/half.txt",
        "h");
    StagingCopies::record(staged);
    tamberJson({"item", inbox});
    EXPECT_FALSE(fs::exists(staged));
    EXPECT_TRUE(fs::is_empty(state / "ledger"));
}

TEST_F(BoundaryCommandsTest, PathAnswersTheContainersAndRefusesOutside) {
    EXPECT_EQ(tamberJson({"path", "root"})["path"], storage);
    EXPECT_EQ(tamberJson({"path", "working-set"})["path"], storage);
    tamberJson({"apps"});
    EXPECT_EQ(tamberJson({"path", kNotesLibrary})["path"], library);
    std::string file = dir.writeFile("Documents/Shelf/p.txt", "p");
    EXPECT_EQ(tamberJson({"path", file})["path"], file);
    EXPECT_EQ(errorOf({"path", dir.path() + "/outside"})["message"], kOutside);
}

TEST_F(BoundaryCommandsTest, FolderNamesAreCheckedAndNeverReplaced) {
    tamberJson({"mkdir", "Work", inbox});
    json taken = errorOf({"mkdir", "Work", inbox});
    EXPECT_EQ(taken["domain"], "PosixErrorDomain");
    EXPECT_EQ(taken["code"], EEXIST);
    EXPECT_EQ(tamberJson({"mkdir", "Work", inbox, "--bounce"})["filename"], "Work 2");

    EXPECT_EQ(errorOf({"mkdir", ".Trash", inbox})["message"], "name '.Trash' is reserved");
    EXPECT_EQ(errorOf({"mkdir", "a/b", inbox})["message"], "name must not contain '/'");
    EXPECT_EQ(errorOf({"mkdir", "..", inbox})["message"], "name '..' is reserved");
    EXPECT_EQ(errorOf({"mkdir", ".", inbox})["message"], "name '.' is reserved");
    EXPECT_EQ(errorOf({"mkdir", "", inbox})["message"], "name must not be empty");
    EXPECT_FALSE(fs::exists(inbox + "/.Trash"));

    std::string file = dir.writeFile("Documents/Shelf/r.txt", "r");
    EXPECT_EQ(errorOf({"rename", file, ".Trash"})["message"], "name '.Trash' is reserved");
    EXPECT_EQ(errorOf({"mv", file, library, "--name", ".Trash"})["message"],
              "name '.Trash' is reserved");
    EXPECT_TRUE(fs::exists(file));
    EXPECT_EQ(errorOf({"untrash", file})["message"], "item is not in the trash");
}

TEST_F(BoundaryCommandsTest, ImportRefusesWhatItCannotCopySafely) {
    EXPECT_EQ(errorOf({"import", "", inbox})["message"], "the source path must not be empty");
    fs::create_directory(inbox + "/Sub");
    json self = errorOf({"import", inbox, inbox + "/Sub"});
    EXPECT_EQ(self["message"], "can't import a folder into itself");
    json same = errorOf({"import", inbox, inbox});
    EXPECT_EQ(same["message"], "can't import a folder into itself");

    std::string fifo = dir.path() + "/outside-fifo";
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
    EXPECT_EQ(errorOf({"import", fifo, inbox})["message"],
              "can only import a file, a folder or a symbolic link");
    EXPECT_FALSE(fs::exists(inbox + "/outside-fifo"));
}

TEST_F(BoundaryCommandsTest, ALinkIsAnItemAndIsNeverFollowed) {
    std::string esc = escape();
    dir.writeFile("elsewhere/keep.txt", "k");
    std::string id = tamberJson({"item", esc})["identifier"];

    json renamed = tamberJson({"rename", id, "esc2"});
    EXPECT_EQ(renamed["path"], inbox + "/esc2");
    EXPECT_TRUE(fs::is_symlink(inbox + "/esc2"));

    json moved = tamberJson({"mv", inbox + "/esc2", library});
    EXPECT_EQ(moved["path"], library + "/esc2");
    EXPECT_TRUE(fs::is_symlink(library + "/esc2"));

    json trashed = tamberJson({"trash", library + "/esc2"});
    EXPECT_EQ(trashed["path"], library + "/.Trash/esc2");
    EXPECT_TRUE(fs::is_symlink(library + "/.Trash/esc2"));

    tamberJson({"rm", library + "/.Trash/esc2"});
    EXPECT_FALSE(fs::exists(fs::symlink_status(library + "/.Trash/esc2")));
    EXPECT_TRUE(fs::exists(elsewhere + "/keep.txt")) << "the link's target is left alone";
}

}  // namespace
}  // namespace tamber
