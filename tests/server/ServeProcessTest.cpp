#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include <httplib.h>
#include <nlohmann/json.hpp>

#include "tests/common/TempDir.h"

extern char** environ;

namespace tamber::testing {
namespace {

// `tamber --storage S serve --port 0 --no-open` as a child process, with its own runtime,
// state and home folders, so that nothing of the user's is touched.
class ServeProcess {
public:
    ServeProcess(const TempDir& root, const std::string& storage) {
        std::map<std::string, std::string> environment;
        for (char** e = environ; *e; ++e) {
            std::string entry = *e;
            size_t equals = entry.find('=');
            environment[entry.substr(0, equals)] = entry.substr(equals + 1);
        }
        environment["XDG_RUNTIME_DIR"] = root / "run";
        environment["XDG_STATE_HOME"] = root / "state";
        environment["XDG_DATA_HOME"] = root / "data";
        environment["HOME"] = root / "home";
        environment.erase("DISPLAY");
        environment.erase("WAYLAND_DISPLAY");
        std::vector<std::string> entries;
        for (const auto& [name, value] : environment) entries.push_back(name + "=" + value);
        std::vector<char*> envp;
        for (auto& entry : entries) envp.push_back(entry.data());
        envp.push_back(nullptr);

        std::vector<std::string> args{TAMBER_BINARY, "--storage", storage,    "serve",
                                      "--port",      "0",         "--no-open"};
        std::vector<char*> argv;
        for (auto& arg : args) argv.push_back(arg.data());
        argv.push_back(nullptr);

        int out[2], err[2];
        EXPECT_EQ(::pipe(out), 0);
        EXPECT_EQ(::pipe(err), 0);
        posix_spawn_file_actions_t actions;
        posix_spawn_file_actions_init(&actions);
        posix_spawn_file_actions_adddup2(&actions, out[1], 1);
        posix_spawn_file_actions_adddup2(&actions, err[1], 2);
        posix_spawn_file_actions_addclose(&actions, out[0]);
        posix_spawn_file_actions_addclose(&actions, err[0]);
        EXPECT_EQ(::posix_spawn(&pid_, TAMBER_BINARY, &actions, nullptr, argv.data(), envp.data()),
                  0);
        posix_spawn_file_actions_destroy(&actions);
        ::close(out[1]);
        ::close(err[1]);
        outFd_ = out[0];
        errFd_ = err[0];
    }
    ~ServeProcess() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
            ::waitpid(pid_, nullptr, 0);
        }
        ::close(outFd_);
        ::close(errFd_);
    }

    pid_t pid() const { return pid_; }
    // The first line of standard output, or "" when none came within 60 s or the child ended.
    std::string firstLine() {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
        while (out_.find('\n') == std::string::npos &&
               std::chrono::steady_clock::now() < deadline) {
            if (!pump(200))
                break;
        }
        size_t end = out_.find('\n');
        return end == std::string::npos ? "" : out_.substr(0, end);
    }
    // Sends `signal` (none: 0) and waits up to 60 s for the exit status; -1 when it had to be
    // killed or did not exit normally.
    int finish(int signal = 0) {
        if (signal)
            ::kill(pid_, signal);
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
        int status = 0;
        while (std::chrono::steady_clock::now() < deadline) {
            pump(100);
            pid_t done = ::waitpid(pid_, &status, WNOHANG);
            if (done == pid_) {
                pid_ = -1;
                while (pump(0)) {
                }
                return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
            }
        }
        return -1;
    }
    const std::string& out() const { return out_; }
    const std::string& err() const { return err_; }

private:
    bool pump(int timeoutMs) {
        pollfd fds[2] = {{outFd_, POLLIN, 0}, {errFd_, POLLIN, 0}};
        if (::poll(fds, 2, timeoutMs) <= 0)
            return true;
        bool open = false;
        for (int i = 0; i < 2; ++i) {
            if (!(fds[i].revents & (POLLIN | POLLHUP)))
                continue;
            char buffer[4096];
            ssize_t got = ::read(fds[i].fd, buffer, sizeof buffer);
            if (got > 0) {
                (i == 0 ? out_ : err_).append(buffer, static_cast<size_t>(got));
                open = true;
            }
        }
        return open;
    }

    pid_t pid_ = -1;
    int outFd_ = -1;
    int errFd_ = -1;
    std::string out_;
    std::string err_;
};

// The port and token of the URL a server printed; port 0 when the line is not one.
struct Printed {
    int port = 0;
    std::string token;
};
Printed parsePrinted(const std::string& line) {
    Printed printed;
    const std::string marker = "/#token=";
    size_t colon = line.find(':', 5);
    size_t at = line.find(marker);
    if (!line.starts_with("http://127.0.0.1:") || at == std::string::npos)
        return printed;
    printed.port = std::stoi(line.substr(colon + 1, at - colon - 1));
    printed.token = line.substr(at + marker.size());
    return printed;
}

nlohmann::json getJson(const Printed& server, const std::string& path) {
    httplib::Client client("127.0.0.1", server.port);
    client.set_bearer_token_auth(server.token);
    auto response = client.Get(path);
    if (!response || response->status != 200)
        return nullptr;
    return nlohmann::json::parse(response->body, nullptr, false);
}

// Waits until the server says it is ready; its last status either way.
nlohmann::json waitUntilReady(const Printed& server) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(120);
    nlohmann::json status;
    while (std::chrono::steady_clock::now() < deadline) {
        status = getJson(server, "/api/v1/status");
        if (status.is_object() && status["state"] == "ready")
            break;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return status;
}

size_t found(const Printed& server, const std::string& query) {
    auto answer = getJson(server, "/api/v1/search?q=" + query + "&limit=1000");
    return answer.is_object() ? answer["items"].size() : 0;
}

// A server killed in the middle of a catch-up keeps what it committed: the next one catches up
// from the stored anchor and ends up holding exactly what is on disk.
TEST(ServeProcessTest, AServerKilledDuringACatchUpIsCaughtUpByTheNextOne) {
    TempDir root;
    std::string storage = root.makeDir("Documents");
    auto write = [&](const std::string& name) { std::ofstream(storage + "/" + name) << "x"; };
    for (int i = 0; i < 400; ++i) write("old-" + std::to_string(i) + ".txt");
    uint64_t itemsBefore = 0;
    {
        ServeProcess serve(root, storage);
        Printed first = parsePrinted(serve.firstLine());
        ASSERT_NE(first.port, 0) << serve.err();
        auto status = waitUntilReady(first);
        ASSERT_EQ(status["state"], "ready") << status.dump();
        itemsBefore = status["items"];
        ASSERT_EQ(serve.finish(SIGTERM), 0) << serve.err();
    }

    // While nothing runs: enough changes for many pages of changes.
    for (int i = 0; i < 200; ++i)
        std::filesystem::remove(storage + "/old-" + std::to_string(i) + ".txt");
    for (int i = 0; i < 900; ++i) write("new-" + std::to_string(i) + ".txt");
    {
        ServeProcess serve(root, storage);
        Printed second = parsePrinted(serve.firstLine());
        ASSERT_NE(second.port, 0) << serve.err();
        // Killed as soon as it is seen catching up, or at once if it never is.
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
        while (std::chrono::steady_clock::now() < deadline) {
            auto status = getJson(second, "/api/v1/status");
            if (status.is_object() && status["state"] == "catching-up")
                break;
            if (status.is_object() && status["state"] == "ready") {
                std::printf("note: the catch-up ended before it could be interrupted\n");
                break;
            }
        }
        ::kill(serve.pid(), SIGKILL);
        EXPECT_EQ(serve.finish(), -1);
    }

    // Its run file is left behind; the next server takes its place all the same.
    ServeProcess serve(root, storage);
    Printed third = parsePrinted(serve.firstLine());
    ASSERT_NE(third.port, 0) << serve.err();
    auto status = waitUntilReady(third);
    ASSERT_EQ(status["state"], "ready") << status.dump();
    EXPECT_EQ(status["items"].get<uint64_t>(), itemsBefore - 200 + 900);
    EXPECT_EQ(found(third, "new-"), 900u);
    EXPECT_EQ(found(third, "old-"), 200u);
    EXPECT_EQ(serve.finish(SIGTERM), 0) << serve.err();
}

TEST(ServeProcessTest, PrintsTheUrlAnswersAndStopsCleanlyOnSigterm) {
    TempDir root;
    std::string storage = root.makeDir("Documents");
    ServeProcess serve(root, storage);
    std::string line = serve.firstLine();
    ASSERT_TRUE(line.starts_with("http://127.0.0.1:")) << line << serve.err();
    size_t colon = line.find(':', 5);
    size_t slash = line.find('/', colon);
    int port = std::stoi(line.substr(colon + 1, slash - colon - 1));
    std::string marker = "/#token=";
    ASSERT_NE(line.find(marker), std::string::npos) << line;
    std::string token = line.substr(line.find(marker) + marker.size());
    EXPECT_EQ(token.size(), 64u);

    std::string runFile = root / "run/tamber/serve.json";
    ASSERT_TRUE(std::filesystem::exists(runFile));
    EXPECT_EQ(std::filesystem::status(runFile).permissions() & std::filesystem::perms::all,
              std::filesystem::perms::owner_read | std::filesystem::perms::owner_write);

    httplib::Client client("127.0.0.1", port);
    client.set_bearer_token_auth(token);
    auto status = client.Get("/api/v1/status");
    ASSERT_TRUE(status);
    EXPECT_EQ(status->status, 200);
    auto json = nlohmann::json::parse(status->body);
    EXPECT_EQ(json["pid"], serve.pid());

    // A second server for the same storage is refused and names the first.
    ServeProcess second(root, storage);
    EXPECT_NE(second.finish(), 0);
    EXPECT_NE(second.err().find(std::to_string(serve.pid())), std::string::npos) << second.err();
    EXPECT_TRUE(std::filesystem::exists(runFile));

    EXPECT_EQ(serve.finish(SIGTERM), 0) << serve.err();
    EXPECT_FALSE(std::filesystem::exists(runFile));
    EXPECT_EQ(serve.out(), line + "\n");
}

}  // namespace
}  // namespace tamber::testing
