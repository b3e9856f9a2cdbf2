#include <gtest/gtest.h>
#include <signal.h>
#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <memory>
#include <mutex>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "tests/cli/TamberProcess.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

namespace fs = std::filesystem;
using json = nlohmann::json;
using testing::TamberProcess;

// What a lister keeps of the working set: each item's name and parent, by identifier.
using View = std::map<std::string, std::pair<std::string, std::string>>;

// What differs between two views, one line per item.
std::string difference(const View& got, const View& expected) {
    std::string text;
    auto line = [](const std::string& id, const std::pair<std::string, std::string>& entry) {
        return id + " " + entry.first + " in " + entry.second;
    };
    for (const auto& [id, entry] : got) {
        auto it = expected.find(id);
        if (it == expected.end())
            text += "  extra: " + line(id, entry) + "\n";
        else if (it->second != entry)
            text += "  wrong: " + line(id, entry) + " (should be " + line(id, it->second) + ")\n";
    }
    for (const auto& [id, entry] : expected) {
        if (!got.contains(id))
            text += "  missing: " + line(id, entry) + "\n";
    }
    return text;
}

void add(View& view, const json& item) {
    view[item.at("identifier").get<std::string>()] = {
        item.at("filename").get<std::string>(), item.at("parentIdentifier").get<std::string>()};
}

// One actor's runs of `tamber`, one after the other. Every run must end by itself (no hang) and
// not by a signal it was not sent (no crash); the test may ask for the run under way to be
// killed, which the actor does from its own thread.
class Actor {
public:
    Actor(std::string name, std::string storage, std::map<std::string, std::string> environment)
        : name_(std::move(name)),
          storage_(std::move(storage)),
          environment_(std::move(environment)) {}

    struct Run {
        int status = 0;
        bool killed = false;
        std::string out, err;
    };

    Run run(std::vector<std::string> args) {
        args.insert(args.begin(), {"--storage", storage_});
        TamberProcess process(args, environment_);
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(40);
        bool killed = false;
        while (std::chrono::steady_clock::now() < deadline) {
            if (killRequested_.exchange(false)) {
                process.sendSignal(SIGKILL);
                killed = true;
            }
            if (!process.pump(20))
                break;
        }
        Run result;
        result.status = process.finish(20);
        result.killed = killed;
        result.out = process.out();
        result.err = process.err();
        std::string command;
        for (const auto& arg : args) command += " " + arg;
        if (process.timedOut())
            ADD_FAILURE() << name_ << ": tamber" << command << " hung\n" << result.err;
        else if (process.termSignal() != 0 && !(killed && process.termSignal() == SIGKILL))
            ADD_FAILURE() << name_ << ": tamber" << command << " died of signal "
                          << process.termSignal() << "\n"
                          << result.err;
        ++runs_;
        return result;
    }
    void killCurrentRun() { killRequested_ = true; }
    int runs() const { return runs_; }

private:
    std::string name_, storage_;
    std::map<std::string, std::string> environment_;
    std::atomic<bool> killRequested_{false};
    std::atomic<int> runs_{0};
};

// A host that lists the working set, then asks for changes since its anchor over and over.
struct Lister {
    explicit Lister(Actor& actor) : actor(actor) {}

    // Anchor first, then the listing: what changes while it is read comes with the changes.
    bool list() {
        Actor::Run anchorRun = actor.run({"anchor", "working-set"});
        if (anchorRun.status != 0)
            return false;
        Actor::Run listing = actor.run({"ls", "working-set", "--all", "--json"});
        if (listing.status != 0)
            return false;
        View fresh;
        for (const auto& line : splitLines(listing.out)) {
            auto page = json::parse(line, nullptr, false);
            if (page.is_discarded() || !page.contains("items"))
                return false;
            for (const auto& item : page["items"]) add(fresh, item);
        }
        view = std::move(fresh);
        anchor = anchorRun.out.substr(0, anchorRun.out.find('\n'));
        return true;
    }
    // One batch of changes; false when the run failed (killed, or the journal was busy).
    // An expired anchor sends the host back to listing, as the provider asks.
    bool catchUpOnce(bool& more) {
        Actor::Run changes = actor.run({"changes", "working-set", "--anchor", anchor, "--json"});
        auto batch = json::parse(changes.out, nullptr, false);
        if (changes.status != 0 || batch.is_discarded() || !batch.contains("anchor")) {
            if (changes.out.find("-1002") != std::string::npos ||
                changes.err.find("-1002") != std::string::npos)
                ++expired;
            more = false;
            return false;
        }
        for (const auto& change : batch["changes"]) {
            if (change.contains("updated"))
                add(view, change["updated"]);
            else
                view.erase(change["deleted"].get<std::string>());
        }
        anchor = batch["anchor"].get<std::string>();
        more = batch["moreComing"].get<bool>();
        return true;
    }
    static std::vector<std::string> splitLines(const std::string& text) {
        std::vector<std::string> lines;
        size_t start = 0;
        for (size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1) {
            if (end > start)
                lines.push_back(text.substr(start, end - start));
        }
        if (start < text.size())
            lines.push_back(text.substr(start));
        return lines;
    }

    Actor& actor;
    View view;
    std::string anchor;
    int expired = 0;
};

// Several `tamber` processes at once on one storage folder and one state folder: a server
// holding the journal, a follower of its events, two listers catching up, one doing item
// operations, while the test changes files underneath; then the server is killed in the
// middle of an import and the others carry on without it (taking turns with the journal).
class ConcurrentProcessesTest : public ::testing::Test {
protected:
    void SetUp() override {
        storage = home.makeDir("Documents");
        for (const char* folder : {"Documents/Churn", "Documents/Ops", "Documents/Ops/Moved"})
            home.makeDir(folder);
        home.writeFile("Documents/keep.txt", "k");
        for (int i = 0; i < 3; ++i) home.writeFile("src/file" + std::to_string(i) + ".txt", "s");
        // Large enough that an import is still copying when the server is killed.
        std::ofstream(home / "src/big.bin") << std::string(64 << 20, 'b');
        environment = {{"HOME", home.path()},
                       {"XDG_STATE_HOME", home / "state"},
                       {"XDG_RUNTIME_DIR", home.makeDir("run")},
                       {"XDG_DATA_HOME", home / "data"},
                       {"XDG_CONFIG_HOME", home / "config"},
                       {"XDG_DATA_DIRS", home.makeDir("system-data")}};
    }
    std::unique_ptr<TamberProcess> start(std::vector<std::string> args) {
        args.insert(args.begin(), {"--storage", storage});
        return std::make_unique<TamberProcess>(args, environment);
    }
    // The working set as the disk has it: every visible file and folder, with the trash's top.
    std::set<std::string> diskPaths() {
        std::set<std::string> paths;
        for (auto it = fs::recursive_directory_iterator(storage); it != fs::end(it); ++it) {
            if (it->path().filename().string()[0] == '.') {
                it.disable_recursion_pending();
                continue;
            }
            paths.insert(it->path().string());
        }
        std::error_code none;
        for (auto it = fs::directory_iterator(storage + "/.Trash", none); it != fs::end(it); ++it) {
            if (it->path().filename().string()[0] != '.')
                paths.insert(it->path().string());
        }
        return paths;
    }
    std::vector<std::string> stagingLeftovers() {
        std::vector<std::string> found;
        for (auto it = fs::recursive_directory_iterator(storage); it != fs::end(it); ++it) {
            if (it->path().filename().string().starts_with(".tamber-import-"))
                found.push_back(it->path().string());
        }
        return found;
    }

    testing::TempDir home;
    std::string storage;
    std::map<std::string, std::string> environment;
};

TEST_F(ConcurrentProcessesTest, ProcessesKilledMidOperationLeaveAConsistentJournalAndTree) {
    auto server = start({"serve", "--port", "0", "--no-open"});
    ASSERT_TRUE(server->waitForOutput("http://")) << server->err();
    auto follower = start({"events", "--json"});

    std::atomic<bool> stop{false};
    Actor listerA("lister A", storage, environment), listerB("lister B", storage, environment),
        operatorActor("operator", storage, environment);
    Lister hostA(listerA), hostB(listerB);
    auto host = [&](Lister& lister) {
        bool listed = false;
        while (!stop) {
            if (!listed) {
                listed = lister.list();
                continue;
            }
            bool more = false;
            if (!lister.catchUpOnce(more) && lister.expired > 0)
                listed = false;
        }
    };
    std::thread a([&] { host(hostA); }), b([&] { host(hostB); });
    std::atomic<int> operationsDone{0};
    std::thread operations([&] {
        const std::string ops = storage + "/Ops";
        for (int i = 0; !stop; ++i) {
            std::string n = std::to_string(i);
            operatorActor.run({"mkdir", "D" + n, ops});
            operatorActor.run(
                {"import", home / ("src/file" + std::to_string(i % 3) + ".txt"), ops + "/D" + n});
            operatorActor.run(
                {"tag", ops + "/D" + n + "/file" + std::to_string(i % 3) + ".txt", "Red", "Work"});
            operatorActor.run({"rename", ops + "/D" + n, "E" + n});
            operatorActor.run({"mv", ops + "/E" + n, ops + "/Moved"});
            if (i % 2 == 0)
                operatorActor.run({"trash", ops + "/Moved/E" + n});
            ++operationsDone;
        }
    });

    // The test's own changes underneath, until every actor has had a few turns.
    const std::string churn = storage + "/Churn";
    auto churnFor = [&](std::chrono::seconds span, int& i) {
        auto until = std::chrono::steady_clock::now() + span;
        for (; std::chrono::steady_clock::now() < until; ++i) {
            std::ofstream(churn + "/c" + std::to_string(i)) << i;
            std::error_code ignored;
            if (i >= 1)
                fs::rename(churn + "/c" + std::to_string(i - 1),
                           churn + "/r" + std::to_string(i - 1), ignored);
            if (i >= 3)
                fs::remove(churn + "/r" + std::to_string(i - 3), ignored);
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    };
    int churned = 0;
    churnFor(std::chrono::seconds(4), churned);
    listerB.killCurrentRun();
    operatorActor.killCurrentRun();

    // The server is killed while it copies a large import (a file system that copies by
    // reference may finish first: then the next import is tried).
    {
        std::vector<std::unique_ptr<TamberProcess>> imports;
        bool underWay = false;
        for (int attempt = 0; attempt < 5 && !underWay; ++attempt) {
            imports.push_back(start({"import", home / "src/big.bin", storage + "/Ops"}));
            auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
            while (!(underWay = !stagingLeftovers().empty()) &&
                   std::chrono::steady_clock::now() < deadline && imports.back()->pump(2)) {
            }
        }
        if (!underWay)
            std::cerr << "no import was seen under way; the server is killed between them\n";
        server->sendSignal(SIGKILL);
        EXPECT_EQ(server->finish(20), -1);
        EXPECT_EQ(server->termSignal(), SIGKILL);
        for (auto& import : imports) {
            import->finish(30);
            EXPECT_FALSE(import->timedOut()) << "a client of a killed server hung";
        }
    }
    // Without the server the processes take turns with the journal.
    churnFor(std::chrono::seconds(3), churned);
    stop = true;
    a.join();
    b.join();
    operations.join();
    follower->sendSignal(SIGINT);
    follower->finish(20);
    EXPECT_FALSE(follower->timedOut()) << follower->err();
    EXPECT_EQ(follower->termSignal(), 0) << follower->err();
    EXPECT_GT(operationsDone.load(), 0);
    // The follower saw the test's own changes while the server ran.
    EXPECT_NE(follower->out().find(churn + "/c1\""), std::string::npos)
        << follower->out().substr(0, 500);

    // Everything is stopped. The journal's database is whole.
    std::string database;
    for (const auto& entry : fs::recursive_directory_iterator(home / "state/tamber")) {
        if (entry.path().filename() == "journal.sqlite")
            database = entry.path();
    }
    ASSERT_FALSE(database.empty());
    {
        sqlite3* db = nullptr;
        ASSERT_EQ(sqlite3_open_v2(database.c_str(), &db, SQLITE_OPEN_READONLY, nullptr), SQLITE_OK);
        sqlite3_stmt* check = nullptr;
        ASSERT_EQ(sqlite3_prepare_v2(db, "PRAGMA integrity_check", -1, &check, nullptr), SQLITE_OK)
            << sqlite3_errmsg(db);
        ASSERT_EQ(sqlite3_step(check), SQLITE_ROW) << sqlite3_errmsg(db);
        EXPECT_STREQ(reinterpret_cast<const char*>(sqlite3_column_text(check, 0)), "ok");
        sqlite3_finalize(check);
        sqlite3_close(db);
    }

    // The next start sweeps the staging copy of the killed import.
    Actor after("after", storage, environment);
    Actor::Run fresh = after.run({"ls", "working-set", "--all", "--json"});
    ASSERT_EQ(fresh.status, 0) << fresh.err;
    EXPECT_EQ(stagingLeftovers(), std::vector<std::string>{});

    // A fresh listing is the disk...
    View listed;
    std::set<std::string> listedPaths, trashedFolders;
    for (const auto& line : Lister::splitLines(fresh.out)) {
        const json page = json::parse(line);
        for (const auto& item : page["items"]) {
            add(listed, item);
            const std::string path = item.at("path").get<std::string>();
            if (item.at("identifier").get<std::string>().find('=') != std::string::npos)
                listedPaths.insert(path);
            if (path.starts_with(storage + "/.Trash/") &&
                item.at("typeIdentifier") == "public.folder")
                trashedFolders.insert(item.at("identifier").get<std::string>());
        }
    }
    EXPECT_EQ(listedPaths, diskPaths()) << fresh.err;
    // ... and so is what each lister had plus the changes since its last anchor.
    for (Lister* lister : {&hostA, &hostB}) {
        if (lister->anchor.empty()) {
            ADD_FAILURE() << "a lister never listed";
            continue;
        }
        Lister catchingUp(after);
        catchingUp.view = lister->view;
        catchingUp.anchor = lister->anchor;
        bool more = true;
        for (int requests = 0; more && requests < 100; ++requests) {
            ASSERT_TRUE(catchingUp.catchUpOnce(more))
                << "changes since a lister's last anchor failed";
        }
        // A listing shows only the top of the trash: what lies deeper went to the trash with
        // its folder, which a host that saw it before keeps under that folder. Set those
        // aside; everything else must match.
        std::set<std::string> setAside = trashedFolders;
        for (bool dropped = true; dropped;) {
            dropped = false;
            for (auto it = catchingUp.view.begin(); it != catchingUp.view.end();) {
                if (!listed.contains(it->first) && setAside.contains(it->second.second)) {
                    setAside.insert(it->first);
                    it = catchingUp.view.erase(it);
                    dropped = true;
                } else {
                    ++it;
                }
            }
        }
        EXPECT_TRUE(catchingUp.view == listed) << "caught up, compared with a fresh listing:\n"
                                               << difference(catchingUp.view, listed);
    }
    EXPECT_GT(listerA.runs() + listerB.runs(), 4);
}

}  // namespace
}  // namespace tamber
