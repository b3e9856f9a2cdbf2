// Measures `tamber serve` on a large storage, each figure beside a baseline from the same run:
//   - a verb (item, ls one page, id) answered through the server, against the same verb run
//     directly (which starts the journal itself), process start to exit;
//   - server start until `GET status` says ready: cold (no replica) and warm (replica and anchor
//     kept, files changed while it was stopped), against the cold start;
//   - `GET search` over the replica: median and p99, against `GET status` (the API's floor);
//   - `GET containers/{id}/children` of a flat folder, per page;
//   - a file written by this process to the `changes` event that carries it (median, max);
//   - concurrent clients asking for pages and items: requests per second, p99, errors.
//
//   build/bench/bench_server [--files 100000] [--folders 1000] [--flat 100000] [--changed 1000]
//                            [--clients 32] [--seconds 30] [--writes 50] [--dir D]
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <httplib.h>
#include <nlohmann/json.hpp>

using Clock = std::chrono::steady_clock;
using nlohmann::json;

namespace {

struct Options {
    size_t files = 100000;
    size_t folders = 1000;
    size_t flat = 100000;
    size_t changed = 1000;
    size_t clients = 32;
    double seconds = 30;
    size_t writes = 50;
    std::string dir;
};

double since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

double percentile(std::vector<double> values, double p) {
    if (values.empty())
        return 0;
    std::sort(values.begin(), values.end());
    size_t index = static_cast<size_t>(p * static_cast<double>(values.size() - 1) + 0.5);
    return values[std::min(index, values.size() - 1)];
}

std::string gRoot;
pid_t gServer = 0;

void cleanUp() {
    if (gServer > 0) {
        ::kill(gServer, SIGTERM);
        ::waitpid(gServer, nullptr, 0);
        gServer = 0;
    }
    if (!gRoot.empty()) {
        std::error_code ignored;
        std::filesystem::remove_all(gRoot, ignored);
    }
}

void writeFile(const std::string& path) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
    if (fd < 0) {
        std::perror(path.c_str());
        std::exit(1);
    }
    ::close(fd);
}

// The files of the tree and of the flat folder, created under names never used before.
void createStorage(const Options& o, const std::string& storage) {
    auto start = Clock::now();
    for (size_t f = 0; f < o.folders; ++f) {
        std::string folder = storage + "/tree/folder-" + std::to_string(f);
        std::filesystem::create_directories(folder);
        for (size_t i = f; i < o.files; i += o.folders)
            writeFile(folder + "/file-" + std::to_string(i) + (i % 3 == 0 ? ".png" : ".txt"));
    }
    std::filesystem::create_directories(storage + "/flat");
    for (size_t i = 0; i < o.flat; ++i)
        writeFile(storage + "/flat/entry-" + std::to_string(i) + ".txt");
    std::printf("storage: %zu files in %zu folders + %zu flat, made in %.1f s\n", o.files,
                o.folders, o.flat, since(start));
}

// The environment every tamber process of the run gets: its own home and state.
std::vector<std::string> environment(const std::string& home) {
    return {"HOME=" + home,
            "XDG_STATE_HOME=" + home + "/state",
            "XDG_RUNTIME_DIR=" + home + "/run",
            "XDG_DATA_HOME=" + home + "/data",
            "XDG_DATA_DIRS=" + home + "/data",
            "PATH=/usr/bin:/bin"};
}

pid_t spawn(const std::vector<std::string>& args, const std::vector<std::string>& env,
            int stdoutFd) {
    pid_t pid = ::fork();
    if (pid == 0) {
        if (stdoutFd >= 0)
            ::dup2(stdoutFd, 1);
        int null = ::open("/dev/null", O_WRONLY);
        ::dup2(null, 2);
        if (stdoutFd < 0)
            ::dup2(null, 1);
        std::vector<char*> argv, envp;
        for (auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
        argv.push_back(nullptr);
        for (auto& e : env) envp.push_back(const_cast<char*>(e.c_str()));
        envp.push_back(nullptr);
        ::execve(argv[0], argv.data(), envp.data());
        ::_exit(127);
    }
    return pid;
}

// Runs a verb to its end; the seconds it took, or -1 when it failed.
double timeVerb(const std::vector<std::string>& args, const std::vector<std::string>& env) {
    auto start = Clock::now();
    pid_t pid = spawn(args, env, -1);
    int status = 0;
    ::waitpid(pid, &status, 0);
    double seconds = since(start);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? seconds : -1;
}

struct Server {
    int port = 0;
    std::string token;
    double readySeconds = 0;
};

// Starts `tamber serve` and waits until it says it is ready.
Server startServer(const std::string& binary, const std::string& storage,
                   const std::vector<std::string>& env) {
    int pipeFds[2];
    if (::pipe(pipeFds) != 0)
        std::exit(1);
    auto start = Clock::now();
    gServer =
        spawn({binary, "--storage", storage, "serve", "--port", "0", "--no-open"}, env, pipeFds[1]);
    ::close(pipeFds[1]);
    std::string line;
    char c;
    while (::read(pipeFds[0], &c, 1) == 1 && c != '\n') line += c;
    ::close(pipeFds[0]);
    // http://127.0.0.1:PORT/#token=TOKEN
    auto colon = line.find(':', 7);
    auto slash = line.find('/', colon);
    auto token = line.find("#token=");
    if (colon == std::string::npos || slash == std::string::npos || token == std::string::npos) {
        std::fprintf(stderr, "bench_server: the server printed no URL (\"%s\")\n", line.c_str());
        cleanUp();
        std::exit(1);
    }
    Server server;
    server.port = std::stoi(line.substr(colon + 1, slash - colon - 1));
    server.token = line.substr(token + 7);
    httplib::Client client("127.0.0.1", server.port);
    client.set_default_headers({{"Authorization", "Bearer " + server.token}});
    for (;;) {
        auto response = client.Get("/api/v1/status");
        if (response && response->status == 200 &&
            json::parse(response->body, nullptr, false).value("state", "") == "ready")
            break;
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    server.readySeconds = since(start);
    return server;
}

void stopServer() {
    ::kill(gServer, SIGTERM);
    ::waitpid(gServer, nullptr, 0);
    gServer = 0;
}

std::string encode(const std::string& identifier) {
    std::string out;
    for (unsigned char c : identifier) {
        if (std::isalnum(c) || c == '-' || c == '_' || c == '.')
            out += static_cast<char>(c);
        else {
            char buffer[4];
            std::snprintf(buffer, sizeof buffer, "%%%02X", c);
            out += buffer;
        }
    }
    return out;
}

json getJson(httplib::Client& client, const std::string& path) {
    auto response = client.Get(path.c_str());
    if (!response || response->status != 200) {
        std::fprintf(stderr, "bench_server: GET %s failed (%d)\n", path.c_str(),
                     response ? response->status : -1);
        cleanUp();
        std::exit(1);
    }
    return json::parse(response->body);
}

std::string identifierAt(httplib::Client& client, const std::string& path) {
    json item = getJson(client, "/api/v1/lookup?path=" + encode(path));
    if (!item.contains("identifier") || !item["identifier"].is_string()) {
        std::fprintf(stderr, "bench_server: no identifier for %s\n", path.c_str());
        cleanUp();
        std::exit(1);
    }
    return item["identifier"];
}

double medianOf(const std::vector<std::string>& args, const std::vector<std::string>& env,
                int runs) {
    std::vector<double> times;
    for (int i = 0; i < runs; ++i) {
        double t = timeVerb(args, env);
        if (t < 0) {
            std::fprintf(stderr, "bench_server: %s failed\n", args[3].c_str());
            return -1;
        }
        times.push_back(t);
    }
    return percentile(times, 0.5);
}

const char* const kUsage =
    "usage: bench_server [--files 100000] [--folders 1000] [--flat 100000] [--changed 1000]\n"
    "                    [--clients 32] [--seconds 30] [--writes 50] [--dir D]\n";

int run(const Options& o);

}  // namespace

int main(int argc, char** argv) {
    Options o;
    for (int i = 1; i < argc; i += 2) {
        std::string flag = argv[i];
        if (flag == "--help" || flag == "-h") {
            std::fputs(kUsage, stdout);
            return 0;
        }
        if (i + 1 >= argc) {
            std::fprintf(stderr, "bench_server: %s needs a value\n%s", flag.c_str(), kUsage);
            return 2;
        }
        std::string value = argv[i + 1];
        if (flag == "--files")
            o.files = std::stoul(value);
        else if (flag == "--folders")
            o.folders = std::max<size_t>(1, std::stoul(value));
        else if (flag == "--flat")
            o.flat = std::stoul(value);
        else if (flag == "--changed")
            o.changed = std::stoul(value);
        else if (flag == "--clients")
            o.clients = std::max<size_t>(1, std::stoul(value));
        else if (flag == "--seconds")
            o.seconds = std::stod(value);
        else if (flag == "--writes")
            o.writes = std::stoul(value);
        else if (flag == "--dir")
            o.dir = value;
        else {
            std::fprintf(stderr, "bench_server: unknown option %s\n%s", flag.c_str(), kUsage);
            return 2;
        }
    }
    try {
        return run(o);
    } catch (const std::exception& e) {
        // The server and the files made so far do not outlive the run.
        std::fprintf(stderr, "bench_server: %s\n", e.what());
        cleanUp();
        return 1;
    }
}

namespace {

int run(const Options& o) {
    const std::string binary = TAMBER_BINARY;
    char pattern[] = "/tmp/bench-server-XXXXXX";
    gRoot = o.dir.empty() ? std::string(::mkdtemp(pattern)) : o.dir + "/bench-server";
    std::filesystem::create_directories(gRoot + "/home/run");
    ::chmod((gRoot + "/home/run").c_str(), 0700);
    const std::string storage = gRoot + "/storage";
    const auto env = environment(gRoot + "/home");
    createStorage(o, storage);

    // Cold start: no replica, so the whole working set is listed.
    Server server = startServer(binary, storage, env);
    const double cold = server.readySeconds;
    std::printf("start (cold, no replica): %.2f s until ready\n", cold);
    httplib::Client client("127.0.0.1", server.port);
    client.set_default_headers({{"Authorization", "Bearer " + server.token}});
    client.set_read_timeout(60, 0);

    const std::string sample = storage + "/tree/folder-7/file-7.txt";
    const std::string sampleId = identifierAt(client, sample);
    const std::string folderId = identifierAt(client, storage + "/tree/folder-7");
    const std::string flatId = identifierAt(client, storage + "/flat");

    // Verbs through the server, then (server stopped) the same verbs run directly.
    const int runs = 10;
    struct Verb {
        const char* name;
        std::vector<std::string> args;
    };
    std::vector<Verb> verbs = {
        {"item", {binary, "--storage", storage, "item", sampleId}},
        {"ls", {binary, "--storage", storage, "ls", folderId}},
        {"id", {binary, "--storage", storage, "id", sample}},
    };
    std::map<std::string, double> throughServer;
    for (auto& verb : verbs) throughServer[verb.name] = medianOf(verb.args, env, runs);

    // Search: substrings of names, over the whole replica.
    std::vector<double> searches, statuses;
    std::mt19937 random(7);
    for (int i = 0; i < 200; ++i) {
        std::string q = "file-" + std::to_string(random() % o.files);
        auto start = Clock::now();
        getJson(client, "/api/v1/search?q=" + encode(q) + "&limit=50");
        searches.push_back(since(start));
        start = Clock::now();
        getJson(client, "/api/v1/status");
        statuses.push_back(since(start));
    }
    std::printf("search: median %.2f ms, p99 %.2f ms (status: median %.2f ms); ratio %.1fx\n",
                percentile(searches, 0.5) * 1e3, percentile(searches, 0.99) * 1e3,
                percentile(statuses, 0.5) * 1e3,
                percentile(searches, 0.5) / std::max(1e-9, percentile(statuses, 0.5)));

    // Every page of the flat folder.
    std::vector<double> pages;
    std::string page;
    for (;;) {
        auto start = Clock::now();
        json listed = getJson(client, "/api/v1/containers/" + encode(flatId) + "/children" +
                                          (page.empty() ? "" : "?page=" + encode(page)));
        pages.push_back(since(start));
        if (listed["nextPage"].is_null())
            break;
        page = listed["nextPage"];
    }
    std::printf("children of a %zu-entry folder: %zu pages, median %.2f ms, p99 %.2f ms\n", o.flat,
                pages.size(), percentile(pages, 0.5) * 1e3, percentile(pages, 0.99) * 1e3);

    // From a write to the `changes` event that carries it.
    {
        std::mutex mutex;
        std::condition_variable arrived;
        std::string received;
        httplib::Client events("127.0.0.1", server.port);
        events.set_default_headers({{"Authorization", "Bearer " + server.token}});
        events.set_read_timeout(120, 0);
        std::thread reader([&] {
            events.Get("/api/v1/events", [&](const char* data, size_t length) {
                std::lock_guard lock(mutex);
                received.append(data, length);
                arrived.notify_all();
                return true;
            });
        });
        std::vector<double> delays;
        for (size_t i = 0; i < o.writes; ++i) {
            std::string name = "written-" + std::to_string(i) + ".txt";
            auto start = Clock::now();
            writeFile(storage + "/tree/folder-1/" + name);
            std::unique_lock lock(mutex);
            bool seen = arrived.wait_for(lock, std::chrono::seconds(10),
                                         [&] { return received.find(name) != std::string::npos; });
            if (!seen) {
                std::fprintf(stderr, "bench_server: no event for %s\n", name.c_str());
                break;
            }
            delays.push_back(since(start));
        }
        events.stop();
        reader.join();
        std::printf("write to changes event: median %.3f s, max %.3f s over %zu writes\n",
                    percentile(delays, 0.5), percentile(delays, 1.0), delays.size());
    }

    // Concurrent clients asking for pages and items.
    {
        std::atomic<bool> stop{false};
        std::atomic<size_t> errors{0};
        std::mutex mutex;
        std::vector<double> latencies;
        std::vector<std::thread> threads;
        const std::vector<std::string> paths = {
            "/api/v1/items/" + encode(sampleId),
            "/api/v1/containers/" + encode(folderId) + "/children",
            "/api/v1/containers/" + encode(flatId) + "/children",
            "/api/v1/items/" + encode(folderId),
        };
        auto start = Clock::now();
        for (size_t c = 0; c < o.clients; ++c) {
            threads.emplace_back([&, c] {
                httplib::Client one("127.0.0.1", server.port);
                one.set_default_headers({{"Authorization", "Bearer " + server.token}});
                one.set_keep_alive(true);
                std::vector<double> mine;
                for (size_t i = c; !stop; ++i) {
                    auto begin = Clock::now();
                    auto response = one.Get(paths[i % paths.size()].c_str());
                    if (!response || response->status != 200)
                        ++errors;
                    mine.push_back(since(begin));
                }
                std::lock_guard lock(mutex);
                latencies.insert(latencies.end(), mine.begin(), mine.end());
            });
        }
        std::this_thread::sleep_for(std::chrono::duration<double>(o.seconds));
        stop = true;
        for (auto& t : threads) t.join();
        double elapsed = since(start);
        std::printf("%zu clients for %.0f s: %.0f requests/s, p99 %.2f ms, %zu errors\n", o.clients,
                    elapsed, static_cast<double>(latencies.size()) / elapsed,
                    percentile(latencies, 0.99) * 1e3, errors.load());
    }

    // Warm start: the replica and its anchor are kept; files change while it is stopped.
    stopServer();
    for (size_t i = 0; i < o.changed; ++i)
        writeFile(storage + "/tree/folder-" + std::to_string(i % o.folders) + "/changed-" +
                  std::to_string(i) + ".txt");
    server = startServer(binary, storage, env);
    std::printf(
        "start (warm, %zu files changed while stopped): %.2f s until ready; ratio to "
        "cold %.2f\n",
        o.changed, server.readySeconds, server.readySeconds / cold);
    stopServer();

    // The same verbs run directly: each starts the journal itself.
    for (auto& verb : verbs) {
        double direct = medianOf(verb.args, env, runs);
        double remote = throughServer[verb.name];
        std::printf("%-5s direct %.1f ms, through the server %.1f ms: %.1fx faster\n", verb.name,
                    direct * 1e3, remote * 1e3, remote > 0 ? direct / remote : 0.0);
    }
    cleanUp();
    return 0;
}

}  // namespace
