#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <nlohmann/json.hpp>

#include "cli/CliContext.h"
#include "cli/RemoteItem.h"
#include "cli/RemotePorter.h"
#include "cli/ServerClient.h"
#include "runtime/JsonValues.h"
#include "runtime/RunFile.h"
#include "tests/cli/RecordingApiServer.h"
#include "tests/cli/TamberProcess.h"
#include "tests/common/CommandLineTest.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::RecordingApiServer;

constexpr const char* kToken = "s3cret";

const json kItem = {
    {"identifier", "fid=5"}, {"parentIdentifier", "HostPorterRootContainerItemIdentifier"},
    {"filename", "a.txt"},   {"typeIdentifier", "public.plain-text"},
    {"capabilities", 63},    {"tags", json::array()},
    {"trashed", false}};

// The verbs run in this process against a recording stand-in for the server, found through a
// run file in a private runtime folder.
class RemoteCommandsTest : public testing::CommandLineTest {
protected:
    void writeRunFile(pid_t pid, int port, const std::string& forStorage) {
        ASSERT_TRUE(
            RunFile::write(RunFile::defaultLocation(), {pid, port, kToken, forStorage}).ok());
    }

    // A process ID that no process has: a child that has exited and been reaped.
    static pid_t deadPid() {
        pid_t child = ::fork();
        if (child == 0)
            ::_exit(0);
        ::waitpid(child, nullptr, 0);
        return child;
    }

    // A loopback port nothing listens on.
    static int closedPort() {
        int fd = ::socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        EXPECT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&address), length), 0);
        EXPECT_EQ(::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length), 0);
        ::close(fd);
        return ntohs(address.sin_port);
    }

private:
};

TEST_F(RemoteCommandsTest, EveryMutationIsTheRouteWithTheRequestItNames) {
    RecordingApiServer server;
    server.answer("POST /api/v1/containers/#com.example.Notes/children", {200, kItem});
    server.answer("PATCH /api/v1/items/fid=5", {200, kItem});
    server.answer("DELETE /api/v1/items/fid=5", {200, {{"deleted", "fid=5"}}});
    server.answer("POST /api/v1/trash/purge", {200, {{"removed", 2}}});
    server.answer("GET /api/v1/containers/fid=9/anchor", {200, {{"anchor", "AAE="}}});
    writeRunFile(::getpid(), server.port(), storage);

    struct Case {
        std::vector<std::string> args;
        std::string method, target;
        json body;  // null: no body to check
    };
    const std::vector<Case> cases = {
        {{"mkdir", "New folder", "#com.example.Notes", "--bounce"},
         "POST",
         "/api/v1/containers/%23com.example.Notes/children",
         {{"folder", "New folder"}, {"bounce", true}}},
        {{"mkdir", "x/y", "#com.example.Notes"},
         "POST",
         "/api/v1/containers/%23com.example.Notes/children",
         {{"folder", "x/y"}, {"bounce", false}}},
        {{"rename", "fid=5", "b c.txt"},
         "PATCH",
         "/api/v1/items/fid%3D5",
         {{"filename", "b c.txt"}}},
        {{"mv", "fid=5", "fid=9", "--name", "d.txt"},
         "PATCH",
         "/api/v1/items/fid%3D5",
         {{"parentIdentifier", "fid=9"}, {"filename", "d.txt"}}},
        {{"trash", "fid=5"}, "PATCH", "/api/v1/items/fid%3D5", {{"trashed", true}}},
        {{"untrash", "fid=5", "--to", "fid=9"},
         "PATCH",
         "/api/v1/items/fid%3D5",
         {{"trashed", false}, {"parentIdentifier", "fid=9"}}},
        {{"tag", "fid=5", "red", "two words"},
         "PATCH",
         "/api/v1/items/fid%3D5",
         {{"tags", {"red", "two words"}}}},
        {{"rank", "fid=5", "none"}, "PATCH", "/api/v1/items/fid%3D5", {{"favoriteRank", nullptr}}},
        {{"touch", "fid=5", "--clear"},
         "PATCH",
         "/api/v1/items/fid%3D5",
         {{"lastUsedDate", nullptr}}},
        {{"rm", "fid=5"}, "DELETE", "/api/v1/items/fid%3D5", nullptr},
        {{"purge-trash", "--older-than", "30d"},
         "POST",
         "/api/v1/trash/purge?olderThan=30d",
         nullptr},
    };
    for (const auto& c : cases) {
        size_t before = server.requests().size();
        CliRun run = tamber(c.args);
        EXPECT_EQ(run.status, 0) << c.args[0] << ": " << run.err;
        auto requests = server.requests();
        ASSERT_GT(requests.size(), before) << c.args[0] << " asked nothing of the server";
        const auto& last = requests.back();
        EXPECT_EQ(last.method, c.method) << c.args[0];
        EXPECT_EQ(last.target, c.target) << c.args[0];
        EXPECT_EQ(last.authorization, std::string("Bearer ") + kToken);
        if (!c.body.is_null()) {
            EXPECT_EQ(json::parse(last.body, nullptr, false), c.body) << c.args[0];
        }
    }
    EXPECT_EQ(tamber({"purge-trash", "--older-than", "30d"}).out, "removed 2 items\n");
    ASSERT_EQ(tamber({"touch", "fid=5"}).status, 0);
    auto sent = json::parse(server.requests().back().body);
    ASSERT_TRUE(sent["lastUsedDate"].is_string()) << sent;
    EXPECT_TRUE(RemoteItem::parseDate(sent["lastUsedDate"].get<std::string>()));
}

TEST_F(RemoteCommandsTest, LookupsByPathAndIdentifierAndTransfersGoThroughTheServer) {
    const std::string odd = storage + "/a b#?.txt";
    const std::string source = dir.writeFile("outside.txt", "to import");
    RecordingApiServer server;
    server.answer("GET /api/v1/identifiers", {200, {{"identifier", "fid=5"}}});
    server.answer("GET /api/v1/items/fid=5/path", {200, {{"path", odd}}});
    server.answer("GET /api/v1/items/fid=5", {200, kItem});
    server.answer("GET /api/v1/items/fid=7", {200, kItem});
    server.answer("POST /api/v1/containers/fid=5/children", {200, kItem});
    writeRunFile(::getpid(), server.port(), storage);

    CliRun id = tamber({"id", odd});
    EXPECT_EQ(id.status, 0) << id.err;
    EXPECT_EQ(id.out, "fid=5\n");
    EXPECT_EQ(server.requests().back().target,
              "/api/v1/identifiers?path=" + ServerClient::encode(odd));
    CliRun path = tamber({"path", "fid=5"});
    EXPECT_EQ(path.status, 0) << path.err;
    EXPECT_EQ(path.out, odd + "\n");

    // A path outside the published trees is refused here, before the server is asked.
    size_t asked = server.requests().size();
    CliRun outside = tamber({"id", "/etc/passwd"});
    EXPECT_EQ(outside.status, CliContext::kExitFailure);
    EXPECT_EQ(server.requests().size(), asked);

    CliRun imported = tamber({"import", source, "fid=5"});
    EXPECT_EQ(imported.status, 0) << imported.err;
    EXPECT_EQ(json::parse(server.requests().back().body), json({{"import", source}}));

    // No thumbnail from the server is the verb's own "no thumbnail" failure.
    CliRun thumbnail = tamber({"thumbnail", "fid=7", "-o", dir / "icon.png"});
    EXPECT_EQ(thumbnail.status, CliContext::kExitFailure) << thumbnail.err;
    EXPECT_NE(thumbnail.err.find("has no thumbnail"), std::string::npos) << thumbnail.err;
    EXPECT_EQ(server.requests().back().target, "/api/v1/items/fid%3D7/thumbnail");
}

TEST_F(RemoteCommandsTest, RunFilesThatNameNoLiveServerOfThisStorageLeaveTheVerbDirect) {
    dir.writeFile("Documents/here.txt", "x");
    const CliRun alone = tamber({"ls", "root"});
    ASSERT_EQ(alone.status, 0) << alone.err;
    EXPECT_EQ(tamber({"--direct", "ls", "root"}).out, alone.out) << "no server: --direct runs";
    RecordingApiServer server;

    writeRunFile(deadPid(), server.port(), storage);
    EXPECT_EQ(tamber({"ls", "root"}).out, alone.out) << "the server's process is gone";
    writeRunFile(::getpid(), server.port(), dir.makeDir("Elsewhere"));
    EXPECT_EQ(tamber({"ls", "root"}).out, alone.out) << "a server of another storage";
    writeRunFile(::getpid(), server.port(), storage);
    ASSERT_EQ(::truncate(RunFile::defaultLocation().path().c_str(), 7), 0);
    EXPECT_EQ(tamber({"ls", "root"}).out, alone.out) << "a malformed run file";
    EXPECT_TRUE(server.requests().empty());

    // A live server of this storage: --direct is refused, naming it.
    writeRunFile(::getpid(), server.port(), storage);
    CliRun direct = tamber({"--direct", "ls", "root"});
    EXPECT_EQ(direct.status, CliContext::kExitFailure);
    EXPECT_NE(direct.err.find("pid " + std::to_string(::getpid())), std::string::npos)
        << direct.err;
    EXPECT_TRUE(direct.out.empty());
    EXPECT_TRUE(server.requests().empty());
}

TEST_F(RemoteCommandsTest, AServerThatIsGoneIsAnErrorNotAHang) {
    writeRunFile(::getpid(), closedPort(), storage);
    for (const auto& args : std::vector<std::vector<std::string>>{
             {"item", "root"}, {"ls", "root"}, {"status"}, {"purge-trash", "--older-than", "1d"}}) {
        CliRun run = tamber(args);
        EXPECT_EQ(run.status, CliContext::kExitFailure) << args[0] << ": " << run.out;
        EXPECT_NE(run.err.find("did not answer"), std::string::npos) << args[0] << ": " << run.err;
    }
}

TEST_F(RemoteCommandsTest, StatusAndSearchAskTheServerAndSayWhenThereIsNone) {
    CliRun none = tamber({"status"});
    EXPECT_EQ(none.status, CliContext::kExitNotFound);
    EXPECT_EQ(none.err, "tamber: no server running\n");
    CliRun noSearch = tamber({"search", "x"});
    EXPECT_EQ(noSearch.status, CliContext::kExitFailure);
    EXPECT_NE(noSearch.err.find("tamber serve"), std::string::npos) << noSearch.err;

    RecordingApiServer server;
    json status = {
        {"state", "ready"},     {"items", 12},   {"journalLag", 0}, {"lastEventTime", nullptr},
        {"historyLost", false}, {"sequence", 4}, {"pid", 77},       {"storage", storage},
        {"extra", "x"}};
    server.answer("GET /api/v1/status", {200, status});
    json other = kItem;
    other["identifier"] = "fid=6";
    other["filename"] = "\xef\xbf\xbd.png";
    other["filenameBytes"] = "/y5wbmc=";
    other["typeIdentifier"] = "public.png";
    server.answer("GET /api/v1/search", {200, {{"items", {kItem, other}}}});
    writeRunFile(::getpid(), server.port(), storage);

    CliRun text = tamber({"status"});
    EXPECT_EQ(text.status, 0) << text.err;
    EXPECT_EQ(text.out,
              "state: ready\nitems: 12\njournalLag: 0\nlastEventTime: -\n"
              "historyLost: false\nsequence: 4\npid: 77\nstorage: " +
                  storage + "\nextra: x\n");
    EXPECT_EQ(json::parse(tamber({"status", "--json"}).out), status);

    CliRun found = tamber({"search", "a b&c", "--tag", "red", "--type", "public.image",
                           "--favorites", "--recent", "--trashed", "--limit", "5"});
    EXPECT_EQ(found.status, 0) << found.err;
    EXPECT_EQ(found.out, "fid=5\ta.txt\tpublic.plain-text\nfid=6\t\\377.png\tpublic.png\n");
    EXPECT_EQ(server.requests().back().target,
              "/api/v1/search?q=a%20b%26c&tag=red&type=public.image&favorite=true&recent=true&"
              "trashed=true&limit=5");
    EXPECT_EQ(tamber({"search", "", "--json"}).out,
              jsonText(json{{"items", {kItem, other}}}) + "\n");
    EXPECT_EQ(tamber({"search", "x", "--limit", "0"}).status, CliContext::kExitUsage);
}

TEST_F(RemoteCommandsTest, WatchPrintsTheSignalsOfTheServersStream) {
    RecordingApiServer server;
    server.answer("GET /api/v1/containers/fid=9/anchor", {200, {{"anchor", "AAE="}}});
    server.answerStream("/api/v1/events", [](httplib::DataSink& sink) {
        const std::string events =
            ": keep-alive\n\n"
            "id: 3\nevent: changes\ndata: {\"updated\": [], \"deleted\": [\"fid=1\"]}\n\n"
            "event: signal\ndata: {\"container\": \"fid=9\"}\n\n"
            "event: signal\ndata: {\"container\": \"HostPorterWorkingSetContainerItemIdentifier\"}"
            "\n\n";
        sink.write(events.data(), events.size());
    });
    writeRunFile(::getpid(), server.port(), storage);
    // The stand-in ends its stream after two signals: the watch says the server ended it.
    CliRun watched = tamber({"watch", "fid=9"});
    EXPECT_EQ(watched.status, CliContext::kExitFailure);
    EXPECT_NE(watched.err.find("ended the stream"), std::string::npos) << watched.err;
    ASSERT_EQ(testing::occurrences(watched.out, "\n"), 2u) << watched.out;
    EXPECT_NE(watched.out.find("Z\tfid=9\n"), std::string::npos) << watched.out;
    EXPECT_NE(watched.out.find("Z\tHostPorterWorkingSetContainerItemIdentifier\n"),
              std::string::npos);
    // A container the server cannot list fails before any stream, as it does directly.
    CliRun missing = tamber({"watch", "fid=404"});
    EXPECT_EQ(missing.status, CliContext::kExitNotFound) << missing.err;
}

// Ctrl-C ends a watch through the server as it ends a direct one: status 0, whatever the
// stream was doing.
TEST_F(RemoteCommandsTest, AnInterruptEndsAWatchOfTheServersStream) {
    RecordingApiServer server;
    server.answerStream("/api/v1/events", [](httplib::DataSink& sink) {
        const std::string signal = "event: signal\ndata: {\"container\": \"fid=9\"}\n\n";
        if (!sink.write(signal.data(), signal.size()))
            return;
        // Open until the client goes (or the server stops): a comment now and then finds out.
        const std::string comment = ": keep-alive\n\n";
        while (sink.write(comment.data(), comment.size()))
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
    });
    writeRunFile(::getpid(), server.port(), storage);
    testing::TamberProcess watch({"--storage", storage, "watch"},
                                 {{"XDG_RUNTIME_DIR", runtimeDir.path()}});
    // Once the stream is asked for, the watch is in its loop.
    for (int i = 0; i < 600 && server.requests().empty(); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    ASSERT_FALSE(server.requests().empty()) << "the watch never asked for the stream";
    EXPECT_EQ(server.requests().front().target, "/api/v1/events");
    ASSERT_EQ(::kill(watch.pid(), SIGINT), 0);
    EXPECT_EQ(watch.finish(), 0) << watch.err();
    EXPECT_TRUE(watch.err().empty()) << watch.err();
}

}  // namespace
}  // namespace tamber
