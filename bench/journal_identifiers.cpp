// Measures the event journal and item identifiers on a tree it builds, each beside a baseline
// measured in the same run: journal ingest against the same creation with nothing watching,
// and replay, identifiers (given a page at a time, asked first one by one, empty and warm
// resource cache) and "did=" resolution against a plain statx loop over the same files, run just
// before each of them so that load from other processes hits both alike.
//
//   build/bench/bench_journal_identifiers [--files 100000] [--folders 1000] [--dir $TMPDIR]
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "host/HostPorterManager.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/FileSystem.h"
#include "platform/Url.h"
#include "platform/objects/Array.h"
#include "platform/tremors/TremorService.h"
#include "platform/tremors/Tremors.h"
#include "support/DispatchSemaphore.h"

using namespace tamber;
using Clock = std::chrono::steady_clock;

namespace {

struct Options {
    size_t files = 100000;
    size_t folders = 1000;
    std::string dir;
};

double since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

// Everything under `gRoot` goes at exit, also when the run fails or is interrupted.
std::string gRoot;
std::atomic<bool> gInterrupted{false};

void onSignal(int) {
    gInterrupted.store(true);
}

void cleanUp() {
    // Stopped first, so that removing the tree is not journaled.
    if (auto service = TremorService::sharedIfRunning())
        service->shutdown();
    if (!gRoot.empty()) {
        std::fprintf(stderr, "removing %s\n", gRoot.c_str());
        auto start = Clock::now();
        std::error_code ignored;
        std::filesystem::remove_all(gRoot, ignored);
        gRoot.clear();
        std::fprintf(stderr, "  removed in %.1f s\n", since(start));
    }
}

[[noreturn]] void die(const std::string& what) {
    std::fprintf(stderr, "bench_journal_identifiers: %s\n", what.c_str());
    cleanUp();
    std::exit(1);
}

void checkInterrupted() {
    if (gInterrupted.load())
        die("interrupted");
}

size_t parseCount(const char* flag, const char* text) {
    char* end = nullptr;
    errno = 0;
    unsigned long long value = std::strtoull(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || value == 0)
        die(std::string(flag) + " needs a positive number, not \"" + text + "\"");
    return static_cast<size_t>(value);
}

Options parseOptions(int argc, char** argv) {
    Options options;
    const char* tmp = std::getenv("TMPDIR");
    options.dir = tmp && *tmp ? tmp : "/tmp";
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (i + 1 >= argc || (arg != "--files" && arg != "--folders" && arg != "--dir")) {
            die("usage: bench_journal_identifiers [--files N] [--folders M] [--dir DIR]");
        }
        const char* value = argv[++i];
        if (arg == "--files")
            options.files = parseCount("--files", value);
        else if (arg == "--folders")
            options.folders = parseCount("--folders", value);
        else
            options.dir = value;
    }
    if (options.folders > options.files)
        die("--folders cannot exceed --files");
    return options;
}

// A fresh directory under `parent`, as mkdtemp makes one, through the platform layer.
std::string makeUniqueDirectory(const std::string& parent) {
    std::mt19937_64 random(std::random_device{}());
    for (int attempt = 0; attempt < 100; ++attempt) {
        char name[32];
        std::snprintf(name, sizeof name, "tamber-bench-%012llx",
                      static_cast<unsigned long long>(random() & 0xffffffffffffULL));
        std::string path = Url::fileURLWithPath(parent + "/" + name).path();
        if (FileSystem::current().mkdir(path, 0700) == 0)
            return path;
        if (errno != EEXIST)
            die("can't create a directory under " + parent + ": " + std::strerror(errno));
    }
    die("can't find a free directory name under " + parent);
}

void makeDirectory(const std::string& path) {
    if (FileSystem::current().mkdir(path, 0755) != 0)
        die("can't create " + path + ": " + std::strerror(errno));
}

// `files` names in `folders` folders of consecutive files; `prefix` keeps the names of every
// tree new, since recreating just-deleted names is much slower and would distort the figures.
struct Tree {
    std::string root;
    std::vector<std::string> folders;
    std::vector<std::string> files;
    std::vector<size_t> folderOf;
};

Tree layOutTree(const std::string& root, const std::string& prefix, const Options& options) {
    Tree tree{root, {}, {}, {}};
    tree.folders.reserve(options.folders);
    for (size_t k = 0; k < options.folders; ++k)
        tree.folders.push_back(root + "/" + prefix + "-folder-" + std::to_string(k));
    tree.files.reserve(options.files);
    tree.folderOf.reserve(options.files);
    for (size_t i = 0; i < options.files; ++i) {
        size_t folder = i * options.folders / options.files;
        tree.files.push_back(tree.folders[folder] + "/" + prefix + "-" + std::to_string(i) +
                             ".txt");
        tree.folderOf.push_back(folder);
    }
    return tree;
}

void progress(const char* what, size_t done, size_t total) {
    if (total >= 10 && done % (total / 10) != 0 && done != total)
        return;
    std::fprintf(stderr, "  %s: %zu/%zu\n", what, done, total);
}

// Creates files [begin, end) and their folders, writing a few bytes in each as a saved
// document has; a range starts at a folder's first file. Returns the seconds it took.
double createFiles(const Tree& tree, const char* what, size_t begin, size_t end) {
    FileSystem& fs = FileSystem::current();
    static const char kContent[] = "benchmark document\n";
    auto start = Clock::now();
    for (size_t i = begin; i < end; ++i) {
        if (i == 0 || tree.folderOf[i] != tree.folderOf[i - 1])
            makeDirectory(tree.folders[tree.folderOf[i]]);
        int fd = fs.open(tree.files[i], O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0644);
        if (fd < 0)
            die("can't create " + tree.files[i] + ": " + std::strerror(errno));
        if (fs.write(fd, kContent, sizeof kContent - 1) != ssize_t(sizeof kContent - 1))
            die("can't write " + tree.files[i] + ": " + std::strerror(errno));
        fs.close(fd);
        if ((i + 1) % 1000 == 0)
            checkInterrupted();
        progress(what, i + 1, tree.files.size());
    }
    return since(start);
}

// The first file of the second half of the folders.
size_t middleFolderStart(const Tree& tree) {
    size_t middle = tree.folders.size() / 2;
    size_t i = 0;
    while (i < tree.files.size() && tree.folderOf[i] < middle) ++i;
    return i;
}

// The baseline of the read measures: one statx per file, nothing else.
double statxLoop(const std::vector<std::string>& paths) {
    FileSystem& fs = FileSystem::current();
    size_t found = 0;
    auto start = Clock::now();
    for (const auto& path : paths) {
        struct statx st {};
        found += fs.statx(AT_FDCWD, path, AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS, &st) == 0;
    }
    double seconds = since(start);
    if (found != paths.size())
        die("statx missed " + std::to_string(paths.size() - found) + " files");
    return seconds;
}

struct Row {
    std::string measure;
    size_t items = 0;
    double seconds = 0;
    bool perSecond = true;  // else µs per item
    const char* unit = "";  // of the per-second figures
    std::string baselineName;
    size_t baselineItems = 0;
    double baselineSeconds = 0;
    const char* baselineUnit = "";
};

std::string figure(bool perSecond, const char* unit, size_t items, double seconds) {
    char text[48];
    if (perSecond)
        std::snprintf(text, sizeof text, "%.0f %s/s", double(items) / seconds, unit);
    else
        std::snprintf(text, sizeof text, "%.2f us/item", seconds * 1e6 / double(items));
    return text;
}

void printTable(const std::vector<Row>& rows) {
    std::printf("%-40s %9s %9s %20s %20s %7s  %s\n", "measure", "items", "seconds",
                "per second / us", "baseline", "ratio", "baseline measured");
    for (const auto& r : rows) {
        std::printf("%-40s %9zu %9.3f %20s %20s %6.2fx  %s (%zu, %.3f s)\n", r.measure.c_str(),
                    r.items, r.seconds, figure(r.perSecond, r.unit, r.items, r.seconds).c_str(),
                    figure(r.perSecond, r.baselineUnit, r.baselineItems, r.baselineSeconds).c_str(),
                    r.seconds / r.baselineSeconds, r.baselineName.c_str(), r.baselineItems,
                    r.baselineSeconds);
    }
    std::printf(
        "\nratio: seconds for the whole tree against the baseline's seconds for the same files "
        "(above 1: slower than the baseline)\n");
}

// What the replay stream saw, filled on its queue.
struct ReplayCount {
    size_t events = 0;
    size_t createdFiles = 0;
    size_t dropped = 0;
    size_t entries = 0;
    DispatchSemaphore historyDone{0};
};

void countReplay(TremorStreamRef, void* info, size_t count, const ObjectRef& paths,
                 const uint32_t* flags, const uint64_t*) {
    auto& seen = *static_cast<ReplayCount*>(info);
    // The entries are read as a client would read them, so building them is not wasted.
    if (auto array = objectCast<Array>(paths))
        seen.entries += array->count();
    for (size_t i = 0; i < count; ++i) {
        if (flags[i] & kTremorHistoryDone) {
            seen.historyDone.signal();
            continue;
        }
        ++seen.events;
        if (flags[i] & (kTremorUserDropped | kTremorKernelDropped))
            ++seen.dropped;
        if ((flags[i] & kTremorItemCreated) && (flags[i] & kTremorItemIsFile))
            ++seen.createdFiles;
    }
}

// Replays the history of `root` from event 0 and stops at the history-done event, as
// `tamber events --no-follow` does; returns the seconds from creating the stream to that event.
double replayFromZero(const std::string& root, ReplayCount& seen) {
    TremorStreamContext context;
    context.info = &seen;
    auto queue = DispatchQueue::makeSerial("tamber.bench-replay");
    auto start = Clock::now();
    TremorStreamRef stream = TremorStreamCreate(
        countReplay, &context, {root}, 0, 0.1,
        kTremorCreateUseObjects | kTremorCreateFileEvents | kTremorCreateUseExtendedData);
    if (!stream)
        die("can't create the replay stream");
    TremorStreamSetDispatchQueue(stream, queue);
    if (!TremorStreamStart(stream))
        die("can't start the replay stream");
    while (!seen.historyDone.wait(0.2)) checkInterrupted();
    double seconds = since(start);
    TremorStreamStop(stream);
    queue->sync([] {});  // no batch is being counted any more
    TremorStreamInvalidate(stream);
    TremorStreamRelease(stream);
    return seconds;
}

bool isDocumentIdentifier(const std::optional<HostPorterItemIdentifier>& identifier) {
    return identifier && identifier->rfind("did=", 0) == 0;
}

// The run's trees and what each measure leaves for the next.
struct Run {
    Options options;
    std::shared_ptr<TremorService> service;
    Tree watched;
    Tree plain;
    std::vector<Row> rows;
    uint64_t ingested = 0;
    std::vector<HostPorterItemIdentifier> identifiers;
};

// The same creation where nothing watches and in the watched tree, there until the journal
// covers every creation. The unwatched tree is made half before and half after, so that the
// file system's speed drifting over the run (other processes share it) hits both alike.
void measureIngest(Run& run) {
    size_t middle = middleFolderStart(run.plain);
    std::fprintf(stderr, "creating the unwatched tree, first half\n");
    double plainSeconds = createFiles(run.plain, "unwatched", 0, middle);

    std::fprintf(stderr, "creating the watched tree\n");
    std::atomic<uint64_t> appended{0};
    uint64_t listener = run.service->addListener(
        [&](uint32_t, const std::vector<JournalEvent>& events) { appended += events.size(); });
    std::mutex mutex;
    std::condition_variable wake;
    bool done = false;
    // Shows whether the journal keeps up. An interrupt stops the service, which also ends a
    // sync() that would otherwise wait for the whole backlog.
    std::thread reporter([&] {
        std::unique_lock lock(mutex);
        uint64_t reported = 0;
        auto reportedAt = Clock::now();
        while (!wake.wait_for(lock, std::chrono::milliseconds(250), [&] { return done; })) {
            if (gInterrupted.load()) {
                run.service->shutdown();
                return;
            }
            double interval = since(reportedAt);
            if (interval < 5)
                continue;
            uint64_t now = appended.load();
            std::fprintf(stderr, "  journal: %llu events appended, %.0f/s over the last %.0f s\n",
                         static_cast<unsigned long long>(now), double(now - reported) / interval,
                         interval);
            reported = now;
            reportedAt = Clock::now();
        }
    });

    uint64_t firstId = TremorsGetCurrentEventId();
    auto start = Clock::now();
    createFiles(run.watched, "watched", 0, run.watched.files.size());
    double created = since(start);
    // Returns once everything the kernel queued so far is journaled.
    uint64_t lastId = TremorsGetCurrentEventId();
    double seconds = since(start);
    {
        std::lock_guard lock(mutex);
        done = true;
    }
    wake.notify_one();
    reporter.join();
    run.service->removeListener(listener);
    checkInterrupted();
    if (lastId <= firstId)
        die("the journal recorded nothing while the tree was created");
    run.ingested = lastId - firstId;
    std::fprintf(stderr, "  journaled %llu events; %.3f s creating, %.3f s draining after\n",
                 static_cast<unsigned long long>(run.ingested), created, seconds - created);

    std::fprintf(stderr, "creating the unwatched tree, second half\n");
    plainSeconds += createFiles(run.plain, "unwatched", middle, run.plain.files.size());
    run.rows.push_back({"journal ingest (create, until journaled)", size_t(run.ingested), seconds,
                        true, "events", "same creation, unwatched", run.options.files, plainSeconds,
                        "files"});
}

void measureReplay(Run& run) {
    std::fprintf(stderr, "replaying from event 0\n");
    double baseline = statxLoop(run.watched.files);
    ReplayCount seen;
    double seconds = replayFromZero(run.watched.root, seen);
    if (seen.entries != seen.events + 1)
        die("the replay delivered " + std::to_string(seen.entries) + " entries for " +
            std::to_string(seen.events) + " events");
    if (seen.events < run.ingested) {
        std::fprintf(stderr, "  warning: the replay shows %zu events of the %llu journaled\n",
                     seen.events, static_cast<unsigned long long>(run.ingested));
    }
    if (seen.createdFiles < run.options.files) {
        std::fprintf(stderr, "  warning: the replay shows %zu file creations for %zu files\n",
                     seen.createdFiles, run.options.files);
    }
    if (seen.dropped)
        std::fprintf(stderr, "  warning: %zu dropped-history events in the replay\n", seen.dropped);
    run.rows.push_back({"replay from 0 (until history done)", seen.events, seconds, true, "events",
                        "statx loop", run.options.files, baseline, "stat"});
}

// Half of the files are given their document IDs by the page listing's batch, a page of
// `kPage` at a time; the other half by the first ask of each file alone. The next fresh Url
// finds that ID in the index; a Url asked before has it in its own cache.
constexpr size_t kPage = 200;

void measureIdentifiers(Run& run) {
    const auto& files = run.watched.files;
    auto& identifiers = run.identifiers;
    identifiers.resize(files.size());
    size_t half = files.size() / 2;
    std::vector<std::string> batched(files.begin(), files.begin() + half);
    std::vector<std::string> single(files.begin() + half, files.end());

    std::fprintf(stderr, "identifiers, a page of %zu at a time\n", kPage);
    double baseline = statxLoop(batched);
    std::vector<Url> pageUrls;
    double seconds = 0;
    for (size_t begin = 0; begin < batched.size(); begin += kPage) {
        size_t end = std::min(batched.size(), begin + kPage);
        pageUrls.clear();
        for (size_t i = begin; i < end; ++i) pageUrls.push_back(Url::fileURLWithPath(batched[i]));
        auto start = Clock::now();
        TBFileObjectIdentifier::prepareItemIdentifiers(pageUrls);
        seconds += since(start);
        // Not timed: what the listing then asks of each URL must be the batch's answer.
        for (size_t i = begin; i < end; ++i) {
            auto identifier = TBFileObjectIdentifier::itemIdentifier(pageUrls[i - begin]);
            if (!isDocumentIdentifier(identifier))
                die("no document identifier for " + batched[i]);
            identifiers[i] = std::move(*identifier);
        }
        checkInterrupted();
        progress("pages", end, batched.size());
    }
    run.rows.push_back({"identifier, page of 200 (allocates did)", batched.size(), seconds, false,
                        "", "statx loop", batched.size(), baseline, ""});

    std::fprintf(stderr, "identifiers, first ask\n");
    baseline = statxLoop(single);
    auto start = Clock::now();
    for (size_t i = 0; i < single.size(); ++i) {
        auto identifier = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(single[i]));
        if (!isDocumentIdentifier(identifier))
            die("no document identifier for " + single[i]);
        identifiers[half + i] = std::move(*identifier);
        if ((i + 1) % 1000 == 0)
            checkInterrupted();
        progress("first ask", i + 1, single.size());
    }
    run.rows.push_back({"identifier, first ask (allocates did)", single.size(), since(start), false,
                        "", "statx loop", single.size(), baseline, ""});
    if (std::set<HostPorterItemIdentifier>(identifiers.begin(), identifiers.end()).size() !=
        identifiers.size())
        die("two files were given the same document identifier");

    std::fprintf(stderr, "identifiers, empty resource cache\n");
    baseline = statxLoop(files);
    size_t mismatches = 0;
    start = Clock::now();
    for (size_t i = 0; i < files.size(); ++i) {
        auto identifier = TBFileObjectIdentifier::itemIdentifier(Url::fileURLWithPath(files[i]));
        mismatches += !identifier || *identifier != identifiers[i];
    }
    run.rows.push_back({"identifier, empty resource cache", files.size(), since(start), false, "",
                        "statx loop", files.size(), baseline, ""});
    if (mismatches)
        die(std::to_string(mismatches) + " identifiers changed on a second ask");

    std::fprintf(stderr, "identifiers, warm resource cache\n");
    std::vector<Url> urls;
    urls.reserve(files.size());
    for (const auto& path : files) {
        urls.push_back(Url::fileURLWithPath(path));
        TBFileObjectIdentifier::itemIdentifier(urls.back());
    }
    checkInterrupted();
    baseline = statxLoop(files);
    start = Clock::now();
    for (size_t i = 0; i < urls.size(); ++i) {
        auto identifier = TBFileObjectIdentifier::itemIdentifier(urls[i]);
        mismatches += !identifier || *identifier != identifiers[i];
    }
    run.rows.push_back({"identifier, warm resource cache", files.size(), since(start), false, "",
                        "statx loop", files.size(), baseline, ""});
    if (mismatches)
        die(std::to_string(mismatches) + " cached identifiers differ from the first ones");
}

// "did=" back to the file's path.
void measureResolution(Run& run) {
    std::fprintf(stderr, "resolving identifiers to paths\n");
    checkInterrupted();
    const auto& files = run.watched.files;
    double baseline = statxLoop(files);
    size_t mismatches = 0;
    auto start = Clock::now();
    for (size_t i = 0; i < run.identifiers.size(); ++i) {
        auto url = TBFileObjectIdentifier::fileURLWithItemIdentifier(run.identifiers[i]);
        mismatches += !url || url->path() != files[i];
    }
    run.rows.push_back({"did= to path", files.size(), since(start), false, "", "statx loop",
                        files.size(), baseline, ""});
    if (mismatches)
        die(std::to_string(mismatches) + " identifiers resolved to the wrong path or none");
}

}  // namespace

int main(int argc, char** argv) {
    Run run;
    run.options = parseOptions(argc, argv);
    std::signal(SIGINT, onSignal);
    std::signal(SIGTERM, onSignal);

    gRoot = makeUniqueDirectory(run.options.dir);
    makeDirectory(gRoot + "/state");
    run.watched = layOutTree(gRoot + "/storage", "doc", run.options);
    run.plain = layOutTree(gRoot + "/unwatched", "plain", run.options);
    makeDirectory(run.watched.root);
    makeDirectory(run.plain.root);
    std::printf("%zu files in %zu folders under %s\n\n", run.options.files, run.options.folders,
                gRoot.c_str());

    // A journal of its own, watching the storage folder (empty yet) as the host would.
    TremorService::configure(gRoot + "/state");
    auto service = TremorService::shared();
    if (!service.ok())
        die("the journal did not start: " + service.error().description());
    run.service = service.value();
    if (auto status = run.service->watchTree(run.watched.root); !status.ok())
        die("can't watch " + run.watched.root + ": " + status.error().description());
    HostPorterManager::installDefaultManager(
        std::make_shared<StorageHostPorterManager>(Url::fileURLWithPath(run.watched.root)));

    measureIngest(run);
    measureReplay(run);
    measureIdentifiers(run);
    measureResolution(run);

    printTable(run.rows);
    std::fflush(stdout);
    cleanUp();
    return 0;
}
