#include <gtest/gtest.h>

#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

#include <httplib.h>

#include "cli/CliContext.h"
#include "platform/tremors/TremorService.h"
#include "runtime/RunFile.h"
#include "server/ApiContext.h"
#include "server/JournalRoutes.h"
#include "tests/common/CommandLineTest.h"

namespace tamber {
namespace {

using testing::CliRun;

// `tamber events` answered by the journal routes of a server in this process, over the
// journal the direct runs started: both must print the same.
class RemoteEventsTest : public testing::CommandLineTest {
protected:
    void TearDown() override {
        if (thread_.joinable()) {
            server_.stop();
            thread_.join();
        }
        CommandLineTest::TearDown();
    }

    void startServer() {
        context = std::make_shared<ApiContext>();
        context->storage = Url::fileURLWithPath(storage);
        context->journal = TremorService::sharedIfRunning();
        ASSERT_TRUE(context->journal) << "a direct run started the journal";
        JournalRoutes::add(server_, context);
        port = server_.bind_to_any_port("127.0.0.1");
        thread_ = std::thread([this] { server_.listen_after_bind(); });
        ASSERT_TRUE(
            RunFile::write(RunFile::defaultLocation(), {::getpid(), port, "k", storage}).ok());
    }

    std::shared_ptr<ApiContext> context;
    int port = 0;

private:
    httplib::Server server_;
    std::thread thread_;
};

TEST_F(RemoteEventsTest, TheJournalReplaysTheSameThroughTheServer) {
    // The journal runs from the first verb on; what happens after is journaled.
    ASSERT_EQ(tamber({"events", "--no-follow"}).status, 0);
    dir.writeFile("Documents/one.txt", "1");
    dir.makeDir("Documents/folder");
    dir.writeFile(std::string("Documents/folder/bad\xfe.txt"), "2");
    CliRun text = tamber({"events", "--no-follow"});
    ASSERT_EQ(text.status, 0) << text.err;
    ASSERT_NE(text.out.find("one.txt"), std::string::npos) << text.out;
    CliRun json = tamber({"events", "--no-follow", "--json"});
    CliRun docid = tamber({"events", "--no-follow", "--docid", "--json"});
    CliRun later = tamber({"events", "--no-follow", "--since", "3"});
    CliRun beyond = tamber({"events", "--no-follow", "--since", "999999999"});
    ASSERT_NE(beyond.status, 0);

    startServer();
    auto same = [](const CliRun& direct, const CliRun& remote, const char* what) {
        EXPECT_EQ(remote.status, direct.status) << what << ": " << remote.err;
        EXPECT_EQ(remote.out, direct.out) << what;
        EXPECT_EQ(remote.err, direct.err) << what;
    };
    same(text, tamber({"events", "--no-follow"}), "text");
    same(json, tamber({"events", "--no-follow", "--json"}), "json");
    same(docid, tamber({"events", "--no-follow", "--docid", "--json"}), "docid");
    same(later, tamber({"events", "--no-follow", "--since", "3"}), "since");
    same(beyond, tamber({"events", "--no-follow", "--since", "999999999"}), "beyond the end");

    CliRun outside = tamber({"events", "--no-follow", "/etc"});
    EXPECT_EQ(outside.status, CliContext::kExitFailure) << outside.out;
    EXPECT_EQ(outside.out, "") << "nothing of a tree the server does not publish";
    CliRun forget = tamber({"events", "--forget", storage});
    EXPECT_EQ(forget.status, CliContext::kExitFailure);
    EXPECT_NE(forget.err.find("pid " + std::to_string(::getpid())), std::string::npos)
        << forget.err;
}

TEST_F(RemoteEventsTest, TheRouteRefusesBadRequestsAndEndsFollowedStreamsWhenTheServerStops) {
    ASSERT_EQ(tamber({"events", "--no-follow"}).status, 0);
    startServer();
    httplib::Client client("127.0.0.1", port);
    auto bad = client.Get("/api/v1/journal/events?since=12x");
    ASSERT_TRUE(bad);
    EXPECT_EQ(bad->status, 400);
    EXPECT_NE(bad->body.find("\"error\""), std::string::npos) << bad->body;
    auto outside = client.Get("/api/v1/journal/events?follow=0&path=%2Fetc");
    ASSERT_TRUE(outside);
    EXPECT_NE(outside->status, 200);
    EXPECT_EQ(outside->body.find("passwd"), std::string::npos);

    // A followed stream never ends by itself: the server stopping ends it.
    std::mutex mutex;
    std::string received;
    std::thread follower([&] {
        httplib::Client streaming("127.0.0.1", port);
        // Longer than the route's quiet interval: only the stream's end ends the request.
        streaming.set_read_timeout(60);
        streaming.Get("/api/v1/journal/events", [&](const char* data, size_t length) {
            std::lock_guard lock(mutex);
            received.append(data, length);
            return true;
        });
    });
    // The history-done event (flag 16) says the replay is over and the stream is live.
    for (int i = 0; i < 600; ++i) {
        {
            std::lock_guard lock(mutex);
            if (received.find("\"flags\":16") != std::string::npos)
                break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    JournalRoutes::stopStreams(*context);
    follower.join();
    EXPECT_NE(received.find("\"flags\":16"), std::string::npos) << received;
}

}  // namespace
}  // namespace tamber
