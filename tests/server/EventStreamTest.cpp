#include <chrono>
#include <condition_variable>
#include <fstream>
#include <mutex>
#include <thread>

#include "host/HostPorterEnumerator.h"
#include "runtime/ChangeCollector.h"
#include "server/EventHub.h"
#include "support/DispatchSemaphore.h"
#include "tests/server/ServerTest.h"

namespace tamber::testing {
namespace {

// Reads `GET events` on a thread of its own, keeping what came.
class StreamReader {
public:
    StreamReader(int port, const std::string& token, httplib::Headers headers = {}) {
        thread_ = std::thread([=, this] {
            httplib::Client client("127.0.0.1", port);
            client.set_bearer_token_auth(token);
            client.set_read_timeout(60, 0);
            auto result = client.Get(
                "/api/v1/events", headers,
                [&](const httplib::Response& response) {
                    std::lock_guard lock(mutex_);
                    status_ = response.status;
                    changed_.notify_all();
                    return true;
                },
                [&](const char* data, size_t length) {
                    std::lock_guard lock(mutex_);
                    text_.append(data, length);
                    changed_.notify_all();
                    return true;
                });
            std::lock_guard lock(mutex_);
            ended_ = true;
            changed_.notify_all();
        });
    }
    ~StreamReader() {
        if (thread_.joinable())
            thread_.join();
    }
    // Waits until the stream holds `needle` (false after 30 s: only a fault takes that long).
    bool waitFor(const std::string& needle) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(30),
                                 [&] { return text_.find(needle) != std::string::npos; });
    }
    bool waitForEnd() {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(30), [&] { return ended_; });
    }
    std::string text() {
        std::lock_guard lock(mutex_);
        return text_;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::string text_;
    int status_ = 0;
    bool ended_ = false;
    std::thread thread_;
};

size_t count(const std::string& text, const std::string& needle) {
    size_t n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1))
        ++n;
    return n;
}

class EventStreamTest : public ServerTest {};

TEST_F(EventStreamTest, EachPublishedBatchArrivesOnceInOrderAndStopEndsTheStream) {
    StreamReader reader(server->port(), server->token());
    ASSERT_TRUE(reader.waitFor(": connected"));
    replica->publish(
        {{"updated", nlohmann::json::array()}, {"deleted", {"fid=1"}}, {"changes", {}}});
    replica->publish(
        {{"updated", nlohmann::json::array()}, {"deleted", {"fid=2"}}, {"changes", {}}});
    ASSERT_TRUE(reader.waitFor("id: 2\n"));
    std::string text = reader.text();
    size_t first = text.find("id: 1\nevent: changes\ndata: {");
    ASSERT_NE(first, std::string::npos) << text;
    EXPECT_LT(first, text.find("\"deleted\":[\"fid=1\"]")) << text;
    EXPECT_LT(text.find("id: 1\n"), text.find("id: 2\n"));
    EXPECT_EQ(count(text, "event: changes"), 2u);

    // The server stops although a client still listens, and the stream ends.
    server->stop();
    EXPECT_TRUE(reader.waitForEnd());
}

TEST_F(EventStreamTest, ReconnectingClientGetsEveryMissedBatchOrAReset) {
    for (int i = 1; i <= 4; ++i) replica->publish({{"n", i}});
    {
        StreamReader reader(server->port(), server->token(), {{"Last-Event-ID", "2"}});
        ASSERT_TRUE(reader.waitFor("id: 4\n"));
        replica->publish({{"n", 5}});
        ASSERT_TRUE(reader.waitFor("id: 5\n"));
        std::string text = reader.text();
        EXPECT_EQ(text.find("id: 2\n"), std::string::npos) << text;
        EXPECT_EQ(count(text, "id: 3\n"), 1u);
        EXPECT_EQ(count(text, "id: 4\n"), 1u);
        EXPECT_EQ(count(text, "id: 5\n"), 1u);
        EXPECT_LT(text.find("id: 3\n"), text.find("id: 4\n"));
        EXPECT_EQ(text.find("event: reset"), std::string::npos);
        server->stop();
    }
}

TEST_F(EventStreamTest, HistoryThatIsGoneGivesAReset) {
    for (int i = 1; i <= 3; ++i) replica->publish({{"n", i}});
    replica->forgetThrough(2);
    StreamReader reader(server->port(), server->token(), {{"Last-Event-ID", "1"}});
    ASSERT_TRUE(reader.waitFor("event: reset"));
    replica->publish({{"n", 4}});
    ASSERT_TRUE(reader.waitFor("id: 4\n"));
    EXPECT_EQ(reader.text().find("id: 3\n"), std::string::npos);
    server->stop();
}

TEST_F(EventStreamTest, BadLastEventIdAndMissingTokenAreRefused) {
    EXPECT_EQ(status(client()->Get("/api/v1/events", {{"Last-Event-ID", "abc"}})), 400);
    EXPECT_EQ(status(anonymous()->Get("/api/v1/events")), 401);
}

TEST_F(EventStreamTest, ProviderSignalsReachTheReplicaAndTheStream) {
    StreamReader reader(server->port(), server->token());
    ASSERT_TRUE(reader.waitFor(": connected"));
    // The provider signals the containers a host follows: follow the working set as the
    // replica does, by asking for its changes once and keeping its enumerator.
    auto made = replicaOptions.provider->enumeratorForContainerItemIdentifier(
        HostPorterWorkingSetContainerItemIdentifier);
    ASSERT_TRUE(made.ok());
    auto enumerator = made.value();
    std::optional<HostPorterSyncAnchor> anchor;
    DispatchSemaphore done;
    enumerator->currentSyncAnchorWithCompletionHandler([&](auto value) {
        anchor = std::move(value);
        done.signal();
    });
    done.wait();
    ASSERT_TRUE(anchor);
    auto collector = std::make_shared<ChangeCollector>();
    enumerator->enumerateChangesForObserver(collector, *anchor);
    ASSERT_TRUE(collector->waitFor(30));

    std::ofstream(storage + "/box/written.txt") << "by another process";
    EXPECT_TRUE(replica->waitForSignals(1, 30));
    EXPECT_TRUE(reader.waitFor("event: signal\ndata: {\"container\":"));
    enumerator->invalidate();
    server->stop();
}

TEST_F(EventStreamTest, ServerOpensTheReplicaInItsStateFolderAndShutsItDown) {
    EXPECT_EQ(replicaOptions.databasePath, state.path() + "/replica.db");
    EXPECT_TRUE(replicaOptions.provider != nullptr);
    EXPECT_TRUE(replica->started());
    EXPECT_EQ(replica->listenerCount(), 1u);
    // The replica is owned by the server: look before it goes.
    FakeHostReplica* fake = replica;
    server->stop();
    EXPECT_TRUE(fake->wasShutDown());
    EXPECT_EQ(fake->listenerCount(), 0u);
}

TEST_F(EventStreamTest, StatusAndSearchComeFromTheReplica) {
    ReplicaStatus busy;
    busy.catchingUp = true;
    busy.items = 12;
    busy.journalLagEvents = 3;
    busy.lastEventTime = 1.0e9;
    busy.sequence = 9;
    replica->setStatus(busy);
    auto status = body(client()->Get("/api/v1/status"));
    EXPECT_EQ(status["state"], "catching-up");
    EXPECT_EQ(status["items"], 12);
    EXPECT_EQ(status["journalLag"], 3);
    EXPECT_EQ(status["lastEventTime"], "2001-09-09T01:46:40.000Z");
    EXPECT_EQ(status["sequence"], 9);

    replica->setSearchResults({{{"filename", "cat.png"}}});
    auto found = client()->Get(
        "/api/v1/"
        "search?q=ca&tag=red&type=public.image&favorite=1&recent=true&trashed=false&limit=5");
    EXPECT_EQ(body(found)["items"][0]["filename"], "cat.png");
    auto query = replica->lastQuery();
    ASSERT_TRUE(query);
    EXPECT_EQ(query->text, "ca");
    EXPECT_EQ(query->tag, "red");
    EXPECT_EQ(query->type, "public.image");
    EXPECT_TRUE(query->favorites);
    EXPECT_TRUE(query->recent);
    EXPECT_EQ(query->trashed, false);
    EXPECT_EQ(query->limit, 5u);

    client()->Get("/api/v1/search?q=x");
    EXPECT_FALSE(replica->lastQuery()->trashed.has_value());
    EXPECT_FALSE(replica->lastQuery()->favorites);
    for (const char* bad : {"limit=0", "limit=x", "limit=100000", "favorite=maybe"})
        EXPECT_EQ(this->status(client()->Get(std::string("/api/v1/search?q=a&") + bad)), 400)
            << bad;
}

TEST(EventHubTest, AClientThatFallsBehindIsDroppedNotWaitedFor) {
    EventHub hub(2);
    auto slow = hub.subscribe();
    auto quick = hub.subscribe();
    for (uint64_t i = 1; i <= 2; ++i) hub.publishBatch({i, {{"n", i}}});
    EXPECT_EQ(quick->next(std::chrono::milliseconds(0)).size(), 2u);
    hub.publishBatch({3, {{"n", 3}}});
    EXPECT_FALSE(slow->open());
    EXPECT_TRUE(slow->next(std::chrono::milliseconds(0)).empty());
    ASSERT_TRUE(quick->open());
    auto events = quick->next(std::chrono::milliseconds(0));
    ASSERT_EQ(events.size(), 1u);
    EXPECT_EQ(events[0].sequence, 3u);

    hub.close();
    EXPECT_FALSE(quick->open());
    EXPECT_FALSE(hub.subscribe()->open());
}

TEST(EventHubTest, EventTextIsOneFrameEvenForHostileNames) {
    auto signal = EventHub::signalEvent(std::string("a\nb\xff", 4));
    // A newline in a name must not end the data line early.
    EXPECT_EQ(count(signal.text, "\n"), 3u) << signal.text;
    EXPECT_TRUE(signal.text.ends_with("\n\n"));
    auto batch = EventHub::batchEvent({7, {{"deleted", {"x\ny"}}}});
    EXPECT_TRUE(batch.text.starts_with("id: 7\nevent: changes\ndata: "));
    EXPECT_EQ(count(batch.text, "\n"), 4u);
}

TEST(EventHubTest, AReplicaThatListedAgainTellsClientsToStartOver) {
    // After a full listing the replica's history starts afresh: a client must list again, and
    // a reconnect from this event on must not ask for what came before it.
    auto reset = EventHub::batchEvent({9,
                                       {{"reset", true},
                                        {"updated", nlohmann::json::array()},
                                        {"deleted", nlohmann::json::array()}}});
    EXPECT_EQ(reset.sequence, 9u);
    EXPECT_EQ(reset.text, "id: 9\nevent: reset\ndata: {}\n\n");
}

}  // namespace
}  // namespace tamber::testing
