#include <gtest/gtest.h>

#include <unistd.h>

#include <cstdlib>
#include <optional>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "cli/CliContext.h"
#include "cli/RemoteEventStream.h"
#include "cli/RemoteItem.h"
#include "host/PublishedTrees.h"
#include "runtime/HostJson.h"
#include "runtime/RunFile.h"
#include "tests/cli/RecordingApiServer.h"
#include "tests/common/CommandLineTest.h"

namespace tamber {
namespace {

using nlohmann::json;
using testing::CliRun;
using testing::RecordingApiServer;

constexpr const char* kRoundTripToken = "t0ken-for-tests";

// Items made and described by direct runs, then the same verbs answered by a server that sends
// back exactly what the direct runs printed as JSON: the verbs must print the same bytes and
// exit with the same status either way.
class RemoteRoundTripTest : public testing::CommandLineTest {
protected:
    std::string identifierOf(const std::string& path) {
        CliRun run = tamber({"id", path});
        EXPECT_EQ(run.status, 0) << run.err;
        return run.out.substr(0, run.out.find('\n'));
    }

    // From here on the verbs find `server` as the live server of the storage.
    void serveFrom(const RecordingApiServer& server) {
        RunFileRecord record{::getpid(), server.port(), kRoundTripToken, storage};
        ASSERT_TRUE(RunFile::write(RunFile::defaultLocation(), record).ok());
    }

    static void expectSameRun(const CliRun& direct, const CliRun& remote, const std::string& what) {
        EXPECT_EQ(remote.status, direct.status) << what << "\n" << remote.err;
        EXPECT_EQ(remote.out, direct.out) << what;
        EXPECT_EQ(remote.err, direct.err) << what;
    }

private:
};

TEST_F(RemoteRoundTripTest, ItemsAndListingsPrintTheSameBytesThroughTheServer) {
    dir.writeFile("Documents/plain.txt", "plain");
    const std::string badName = std::string("bad\xff name.txt");
    dir.writeFile("Documents/" + badName, "bytes");
    const std::string tagged = dir.writeFile("Documents/tagged.txt", "tags");
    const std::string trashed = dir.writeFile("Documents/gone.txt", "trash");
    ASSERT_EQ(tamber({"tag", tagged, "red", "Blue label"}).status, 0);
    ASSERT_EQ(tamber({"rank", tagged, "3"}).status, 0);
    ASSERT_EQ(tamber({"touch", tagged}).status, 0);
    const std::string trashedID = identifierOf(trashed);
    ASSERT_EQ(tamber({"trash", trashedID}).status, 0);

    std::vector<std::string> ids = {identifierOf(storage + "/plain.txt"),
                                    identifierOf(storage + "/" + badName), identifierOf(tagged),
                                    trashedID};
    struct Recorded {
        std::string id;
        CliRun text, json;
    };
    std::vector<Recorded> direct;
    for (const auto& id : ids)
        direct.push_back({id, tamber({"item", id}), tamber({"item", id, "--json"})});
    CliRun lsText = tamber({"ls", "root"});
    CliRun lsJson = tamber({"ls", "root", "--json"});
    ASSERT_EQ(lsJson.status, 0) << lsJson.err;
    ASSERT_NE(lsText.out.find("\\377"), std::string::npos) << "the bad byte is escaped";

    RecordingApiServer server;
    for (const auto& recorded : direct) {
        ASSERT_EQ(recorded.json.status, 0) << recorded.json.err;
        server.answer("GET /api/v1/items/" + recorded.id, {200, json::parse(recorded.json.out)});
    }
    server.answer("GET /api/v1/containers/HostPorterRootContainerItemIdentifier/children",
                  {200, json::parse(lsJson.out)});
    serveFrom(server);

    for (const auto& recorded : direct) {
        expectSameRun(recorded.text, tamber({"item", recorded.id}), "item " + recorded.id);
        expectSameRun(recorded.json, tamber({"item", recorded.id, "--json"}),
                      "item --json " + recorded.id);
    }
    expectSameRun(lsText, tamber({"ls", "root"}), "ls root");
    expectSameRun(lsJson, tamber({"ls", "root", "--json"}), "ls root --json");

    // Every answer came from the server, asked with the run's token.
    auto requests = server.requests();
    ASSERT_EQ(requests.size(), 2 * ids.size() + 2);
    for (const auto& request : requests)
        EXPECT_EQ(request.authorization, std::string("Bearer ") + kRoundTripToken);
}

TEST_F(RemoteRoundTripTest, ErrorsKeepTheirExitStatusAndMessageThroughTheServer) {
    const std::string missing = "fid=987654321";
    CliRun directText = tamber({"item", missing});
    CliRun directJson = tamber({"item", missing, "--json"});
    CliRun directVerbose = tamber({"--verbose", "item", missing});
    ASSERT_EQ(directText.status, CliContext::kExitNotFound);

    RecordingApiServer server;
    server.answer("GET /api/v1/items/" + missing, {404, json::parse(directJson.out)});
    serveFrom(server);
    expectSameRun(directText, tamber({"item", missing}), "missing item");
    expectSameRun(directJson, tamber({"item", missing, "--json"}), "missing item, JSON");
    // The domain and code too, which --verbose shows.
    expectSameRun(directVerbose, tamber({"--verbose", "item", missing}), "missing, verbose");
}

TEST_F(RemoteRoundTripTest, ChangesAnchorsAndAppsPrintTheSameThroughTheServer) {
    dir.writeFile("Documents/old.txt", "old");
    CliRun anchorText = tamber({"anchor", "root"});
    ASSERT_EQ(anchorText.status, 0) << anchorText.err;
    CliRun anchorJson = tamber({"anchor", "root", "--json"});
    const std::string anchor = anchorText.out.substr(0, anchorText.out.find('\n'));
    // Changes of both kinds after the anchor, in an order that matters.
    dir.writeFile("Documents/new.txt", "new");
    ASSERT_EQ(::unlink((storage + "/old.txt").c_str()), 0);
    dir.writeFile("Documents/newer.txt", "newer");
    CliRun changesText = tamber({"changes", "root", "--anchor", anchor});
    CliRun changesJson = tamber({"changes", "root", "--anchor", anchor, "--json"});
    ASSERT_EQ(changesJson.status, 0) << changesJson.err;
    ASSERT_NE(changesText.out.find("updated\t"), std::string::npos) << changesText.out;
    CliRun expiredText = tamber({"changes", "root", "--anchor", "AAAA"});
    CliRun expiredJson = tamber({"changes", "root", "--anchor", "AAAA", "--json"});
    ASSERT_NE(expiredText.status, 0);
    CliRun appsText = tamber({"apps"});
    CliRun appsJson = tamber({"apps", "--json"});
    ASSERT_EQ(appsJson.status, 0) << appsJson.err;

    RecordingApiServer server;
    const std::string root = "/api/v1/containers/HostPorterRootContainerItemIdentifier";
    server.answer("GET " + root + "/anchor", {200, json::parse(anchorJson.out)});
    server.answer("GET /api/v1/apps", {200, json::parse(appsJson.out)});
    serveFrom(server);
    expectSameRun(anchorText, tamber({"anchor", "root"}), "anchor");
    expectSameRun(anchorJson, tamber({"anchor", "root", "--json"}), "anchor --json");
    expectSameRun(appsText, tamber({"apps"}), "apps");
    expectSameRun(appsJson, tamber({"apps", "--json"}), "apps --json");
    server.answer("GET " + root + "/changes", {200, json::parse(changesJson.out)});
    expectSameRun(changesText, tamber({"changes", "root", "--anchor", anchor}), "changes");
    expectSameRun(changesJson, tamber({"changes", "root", "--anchor", anchor, "--json"}),
                  "changes --json");
    server.answer("GET " + root + "/changes", {409, json::parse(expiredJson.out)});
    expectSameRun(expiredText, tamber({"changes", "root", "--anchor", "AAAA"}), "expired");
    expectSameRun(expiredJson, tamber({"changes", "root", "--anchor", "AAAA", "--json"}),
                  "expired --json");
    // The anchor travels as the same base64, percent-encoded.
    EXPECT_EQ(server.requests().back().target, root + "/changes?anchor=AAAA");
}

// Each kind of error the command line tells apart by exit status survives the error object.
TEST(RemoteErrorJsonTest, UsageOutsideMissingAndExpiredAnchorComeBackAsTheyLeft) {
    const std::vector<Error> errors = {
        CliContext::usageError("--rank takes an integer, not \"x\""),
        PublishedTrees::outsideError(Url::fileURLWithPath("/etc/passwd")),
        Error::porterErrorForNonExistentItemWithIdentifier("fid=12"),
        Error::syncAnchorExpired(),
        Error::posix(EACCES),
    };
    for (const Error& original : errors) {
        auto rebuilt = HostJson::errorFromJson(HostJson::error(original));
        ASSERT_TRUE(rebuilt) << original.description();
        EXPECT_EQ(rebuilt->domain(), original.domain());
        EXPECT_EQ(rebuilt->code(), original.code());
        EXPECT_EQ(rebuilt->reason(), original.reason());
        EXPECT_EQ(CliContext::exitStatusFor(*rebuilt), CliContext::exitStatusFor(original))
            << original.description();
        EXPECT_EQ(CliContext::isUsageError(*rebuilt), CliContext::isUsageError(original));
        EXPECT_EQ(PublishedTrees::isOutsideError(*rebuilt),
                  PublishedTrees::isOutsideError(original));
        EXPECT_EQ(HostJson::error(*rebuilt), HostJson::error(original));
    }
    EXPECT_EQ(CliContext::exitStatusFor(*HostJson::errorFromJson(HostJson::error(errors[0]))),
              CliContext::kExitUsage);
    EXPECT_EQ(CliContext::exitStatusFor(*HostJson::errorFromJson(HostJson::error(errors[1]))),
              CliContext::kExitFailure)
        << "outside is refused, not missing";
    for (const char* notAnError : {"{}", R"({"error": "x"})", R"({"error": {"domain": 1}})",
                                   R"({"error": {"domain": "D", "code": "7", "message": "m"}})"})
        EXPECT_FALSE(HostJson::errorFromJson(json::parse(notAnError))) << notAnError;
}

TEST(RemoteItemTest, RefusesRecordsWithoutIdentifierOrNameAndReadsDates) {
    EXPECT_FALSE(RemoteItem::fromJson(json::array()).ok());
    EXPECT_FALSE(RemoteItem::fromJson({{"filename", "a"}}).ok());
    EXPECT_FALSE(RemoteItem::fromJson({{"identifier", "fid=1"}}).ok());
    auto item = RemoteItem::fromJson({{"identifier", "fid=1"},
                                      {"filename", "\xef\xbf\xbd.txt"},
                                      {"filenameBytes", "/y50eHQ="},
                                      {"documentSize", 12},
                                      {"lastUsedDate", "2024-05-01T10:00:00.250Z"},
                                      {"creationDate", "yesterday"},
                                      {"tags", {"red"}},
                                      {"trashed", true}});
    ASSERT_TRUE(item.ok());
    EXPECT_EQ(item.value()->filename(), "\xff.txt") << "the exact bytes, not the repaired text";
    EXPECT_EQ(item.value()->documentSize()->uint64Value(), 12u);
    ASSERT_TRUE(item.value()->lastUsedDate());
    EXPECT_DOUBLE_EQ(item.value()->lastUsedDate()->timeIntervalSince1970(), 1714557600.25);
    EXPECT_FALSE(item.value()->creationDate());
    EXPECT_TRUE(item.value()->tagData());
    EXPECT_TRUE(item.value()->isTrashed());
    EXPECT_FALSE(RemoteItem::parseDate("2024-05-01T10:00:00.25Z"));
    EXPECT_FALSE(RemoteItem::parseDate("2024-05-01T10:00:00+02:00"));
}

TEST(RemoteEventStreamTest, EventsSplitAnywhereArriveWholeAndInOrder) {
    const std::string stream =
        ": keep-alive\n\nid: 7\nevent: changes\ndata: {\"updated\": []}\n\n"
        "event: signal\r\ndata: line one\r\ndata:\r\ndata: line three\r\n\r\n"
        "retry: 5\nid: 9\nevent: reset\n\n";
    // Every way of cutting the stream in two gives the same events.
    for (size_t cut = 0; cut <= stream.size(); ++cut) {
        std::vector<RemoteEventStream::Event> events;
        RemoteEventStream reader([&](const auto& event) { events.push_back(event); });
        reader.feed(std::string_view(stream).substr(0, cut));
        reader.feed(std::string_view(stream).substr(cut));
        ASSERT_EQ(events.size(), 3u) << "cut at " << cut;
        EXPECT_EQ(events[0].id, "7");
        EXPECT_EQ(events[0].type, "changes");
        EXPECT_EQ(events[0].data, "{\"updated\": []}");
        EXPECT_EQ(events[1].type, "signal");
        EXPECT_EQ(events[1].data, "line one\n\nline three");
        EXPECT_EQ(events[2].type, "reset");
        EXPECT_EQ(events[2].id, "9");
    }
    std::vector<RemoteEventStream::Event> partial;
    RemoteEventStream reader([&](const auto& event) { partial.push_back(event); });
    reader.feed("event: signal\ndata: x\n");
    EXPECT_TRUE(partial.empty()) << "an event is handed over only once its blank line arrives";
}

}  // namespace
}  // namespace tamber
