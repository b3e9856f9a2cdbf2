#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include <httplib.h>
#include <nlohmann/json.hpp>

#include "platform/tremors/TremorService.h"
#include "server/TamberServer.h"
#include "support/DispatchTimer.h"
#include "support/WorkerPool.h"
#include "tests/common/AppLibraryTest.h"
#include "tests/server/FakeHostReplica.h"

namespace tamber::testing {

// A real server on an ephemeral port over a temporary storage folder, with a fake replica.
class ServerTest : public AppLibraryTest {
protected:
    void SetUp() override {
        AppLibraryTest::SetUp();
        TremorService::resetForTesting();
        DispatchTimer::shared().shutdown();
        WorkerPool::shared().shutdown();
        storage = std::filesystem::canonical(dir.makeDir("Documents")).string();
        // The storage folder itself takes no new items; its folders do.
        std::filesystem::create_directory(storage + "/box");
        startServer();
    }
    void TearDown() override {
        if (server)
            server->stop();
        server.reset();
        TremorService::resetForTesting();
        AppLibraryTest::TearDown();
    }

    void startServer() {
        TamberServerOptions options;
        options.storagePath = storage;
        options.stateDir = state.path();
        options.port = 0;
        options.runFile = runDir / "serve.json";
        options.replicaFactory = [this](HostReplica::Options given) {
            replicaOptions = given;
            auto fake = std::make_unique<FakeHostReplica>();
            replica = fake.get();
            return Result<std::unique_ptr<HostReplica>>(
                std::unique_ptr<HostReplica>(std::move(fake)));
        };
        server = std::make_unique<TamberServer>(std::move(options));
        auto started = server->start();
        ASSERT_TRUE(started.ok()) << started.error().description();
    }

    // A client with the run's token.
    std::unique_ptr<httplib::Client> client() {
        auto c = std::make_unique<httplib::Client>("127.0.0.1", server->port());
        c->set_bearer_token_auth(server->token());
        c->set_read_timeout(60, 0);
        return c;
    }
    // A client without a token.
    std::unique_ptr<httplib::Client> anonymous() {
        auto c = std::make_unique<httplib::Client>("127.0.0.1", server->port());
        c->set_read_timeout(60, 0);
        return c;
    }
    static nlohmann::json body(const httplib::Result& result) {
        if (!result)
            return nullptr;
        return nlohmann::json::parse(result->body, nullptr, false);
    }
    static int status(const httplib::Result& result) { return result ? result->status : -1; }

    httplib::Result postJson(const std::string& path, const nlohmann::json& value) {
        return client()->Post(path, value.dump(), "application/json");
    }
    httplib::Result patchJson(const std::string& path, const nlohmann::json& value) {
        return client()->Patch(path, value.dump(), "application/json");
    }
    // The identifier of the item at `relative` under the storage folder.
    std::string idOf(const std::string& relative) {
        auto result =
            client()->Get("/api/v1/identifiers",
                          httplib::Params{{"path", storage + "/" + relative}}, httplib::Headers{});
        auto json = body(result);
        if (status(result) != 200)
            return "";
        return json["identifier"].get<std::string>();
    }

    std::string storage;
    TempDir state;
    TempDir runDir;
    std::unique_ptr<TamberServer> server;
    FakeHostReplica* replica = nullptr;  // owned by the server
    HostReplica::Options replicaOptions;
};

}  // namespace tamber::testing
