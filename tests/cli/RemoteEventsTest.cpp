#include <gtest/gtest.h>

#include <unistd.h>

#include <cstdlib>
#include <memory>
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
    void SetUp() override {
        CommandLineTest::SetUp();
        if (const char* old = std::getenv("XDG_RUNTIME_DIR"))
            previousRuntimeDir_ = old;
        ::setenv("XDG_RUNTIME_DIR", runtimeDir.path().c_str(), 1);
    }
    void TearDown() override {
        if (thread_.joinable()) {
            server_.stop();
            thread_.join();
        }
        if (previousRuntimeDir_)
            ::setenv("XDG_RUNTIME_DIR", previousRuntimeDir_->c_str(), 1);
        else
            ::unsetenv("XDG_RUNTIME_DIR");
        CommandLineTest::TearDown();
    }

    void startServer() {
        auto context = std::make_shared<ApiContext>();
        context->storage = Url::fileURLWithPath(storage);
        context->journal = TremorService::sharedIfRunning();
        ASSERT_TRUE(context->journal) << "a direct run started the journal";
        JournalRoutes::add(server_, context);
        int port = server_.bind_to_any_port("127.0.0.1");
        thread_ = std::thread([this] { server_.listen_after_bind(); });
        ASSERT_TRUE(
            RunFile::write(RunFile::defaultLocation(), {::getpid(), port, "k", storage}).ok());
    }

    testing::TempDir runtimeDir;

private:
    httplib::Server server_;
    std::thread thread_;
    std::optional<std::string> previousRuntimeDir_;
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

}  // namespace
}  // namespace tamber
