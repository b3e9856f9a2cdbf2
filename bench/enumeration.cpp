// Measures listing and change enumeration, each beside a baseline measured in the same run:
//   - every page of a folder of N files, and every page of a tree of N files in M folders,
//     through LocalFileEnumerator, against a plain getdents + statx + lgetxattr walk;
//   - a change enumeration of C changes (every batch until caught up), in changes per second;
//   - the delay from a file write to the notifier's signal.
//
//   - per page of the flat folder: the time of the first, middle and last pages and the resident
//     memory after them, which must not grow with the page number (run it with
//     --files 1000000 --no-tree for a folder of a million files; not part of the suite).
//
//   build/bench/bench_enumeration [--files 100000] [--folders 1000] [--changes 10000] [--dir D]
//                                 [--no-tree]
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "enumeration/LocalFileEnumerator.h"
#include "fs/FSChangeToken.h"
#include "fs/FSChangesNotifier.h"
#include "fs/TremorReader.h"
#include "host/HostPorterManager.h"
#include "items/TBFileObjectIdentifier.h"
#include "platform/tremors/TremorService.h"
#include "support/DispatchSemaphore.h"

using namespace tamber;
using Clock = std::chrono::steady_clock;

namespace {

struct Options {
    size_t files = 100000;
    size_t folders = 1000;
    size_t changes = 10000;
    std::string dir;
    bool tree = true;
};

double since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

std::string gRoot;

void cleanUp() {
    if (auto service = TremorService::sharedIfRunning())
        service->shutdown();
    if (!gRoot.empty()) {
        std::error_code ignored;
        std::filesystem::remove_all(gRoot, ignored);
        gRoot.clear();
    }
}

[[noreturn]] void die(const std::string& what) {
    std::fprintf(stderr, "bench_enumeration: %s\n", what.c_str());
    cleanUp();
    std::exit(1);
}

size_t parseCount(const std::string& flag, const char* text) {
    char* end = nullptr;
    unsigned long long value = std::strtoull(text, &end, 10);
    if (end == text || *end != '\0' || value == 0)
        die(flag + " needs a positive number, not \"" + text + "\"");
    return static_cast<size_t>(value);
}

constexpr const char* kUsage =
    "usage: bench_enumeration [--files N] [--folders M] [--changes C] [--dir DIR] [--no-tree]";

Options parseOptions(int argc, char** argv) {
    Options options;
    const char* tmp = std::getenv("TMPDIR");
    options.dir = tmp && *tmp ? tmp : "/tmp";
    std::vector<char*> args(argv, argv + argc);
    std::erase_if(args, [&](char* arg) {
        bool noTree = std::string(arg) == "--no-tree";
        if (noTree)
            options.tree = false;
        return noTree;
    });
    argc = static_cast<int>(args.size());
    argv = args.data();
    for (int i = 1; i + 1 < argc; i += 2) {
        std::string flag = argv[i];
        if (flag == "--files")
            options.files = parseCount(flag, argv[i + 1]);
        else if (flag == "--folders")
            options.folders = parseCount(flag, argv[i + 1]);
        else if (flag == "--changes")
            options.changes = parseCount(flag, argv[i + 1]);
        else if (flag == "--dir")
            options.dir = argv[i + 1];
        else
            die(kUsage);
    }
    if (argc % 2 == 0)
        die(kUsage);
    return options;
}

void writeFile(const std::string& path) {
    int fd = ::open(path.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0644);
    if (fd < 0 || ::write(fd, "document\n", 9) != 9)
        die("can't write " + path + ": " + std::strerror(errno));
    ::close(fd);
}

void makeDirectory(const std::string& path) {
    if (::mkdir(path.c_str(), 0755) != 0 && errno != EEXIST)
        die("can't create " + path + ": " + std::strerror(errno));
}

// What a listing must at least do per entry: read the directory, statx each entry, and read
// its attributes' names (and nothing more, as most files have none).
size_t plainWalk(const std::string& path) {
    int dirfd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirfd < 0)
        return 0;
    size_t count = 0;
    std::vector<std::string> subfolders;
    alignas(8) char buffer[1 << 16];
    for (;;) {
        long n = ::syscall(SYS_getdents64, dirfd, buffer, sizeof buffer);
        if (n <= 0)
            break;
        for (long offset = 0; offset < n;) {
            auto* entry = reinterpret_cast<struct dirent64*>(buffer + offset);
            offset += entry->d_reclen;
            if (entry->d_name[0] == '.')
                continue;
            struct statx st {};
            ::statx(dirfd, entry->d_name, AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME,
                    &st);
            std::string child = path + "/" + entry->d_name;
            char names[256];
            (void)::llistxattr(child.c_str(), names, sizeof names);
            ++count;
            if (entry->d_type == DT_DIR)
                subfolders.push_back(child);
        }
    }
    ::close(dirfd);
    for (const auto& folder : subfolders) count += plainWalk(folder);
    return count;
}

class PageObserver : public HostPorterEnumerationObserver {
public:
    void didEnumerateItems(const std::vector<HostPorterItemRef>& items) override {
        count += items.size();
    }
    void finishEnumeratingUpToPage(const std::optional<HostPorterPage>& page) override {
        next = page;
        done.signal();
    }
    void finishEnumeratingWithError(const Error& e) override {
        error = e;
        done.signal();
    }
    size_t count = 0;
    std::optional<HostPorterPage> next;
    std::optional<Error> error;
    DispatchSemaphore done;
};

// The resident memory of this process now and at its peak, in KiB.
struct Resident {
    long now = 0;
    long peak = 0;
};

Resident residentMemory() {
    Resident resident;
    FILE* status = std::fopen("/proc/self/status", "r");
    if (!status)
        return resident;
    char line[256];
    while (std::fgets(line, sizeof line, status)) {
        std::sscanf(line, "VmRSS: %ld", &resident.now);
        std::sscanf(line, "VmHWM: %ld", &resident.peak);
    }
    std::fclose(status);
    return resident;
}

// One page: how long it took, and the memory after it.
struct PageSample {
    double seconds;
    Resident resident;
};

// Lists every page of `container` over `urls`; returns the items seen. With `samples`, each
// page's time and the memory after it.
size_t listAllPages(const HostPorterItemIdentifier& container, const std::vector<Url>& urls,
                    std::vector<PageSample>* samples = nullptr) {
    auto enumerator = LocalFileEnumerator::initWithContainer(container, urls);
    HostPorterPage page = HostPorterInitialPageSortedByName();
    size_t total = 0;
    for (;;) {
        auto observer = std::make_shared<PageObserver>();
        auto pageStart = Clock::now();
        enumerator->enumerateItemsForObserver(observer, page);
        observer->done.wait();
        if (samples)
            samples->push_back({since(pageStart), residentMemory()});
        if (observer->error)
            die("listing failed: " + observer->error->description());
        total += observer->count;
        if (!observer->next)
            break;
        page = *observer->next;
    }
    enumerator->invalidate();
    return total;
}

class ChangeCounter : public HostPorterChangeObserver {
public:
    void didUpdateItems(const std::vector<HostPorterItemRef>& items) override {
        count += items.size();
    }
    void didDeleteItemsWithIdentifiers(const std::vector<HostPorterItemIdentifier>& ids) override {
        count += ids.size();
    }
    void finishEnumeratingChangesUpToSyncAnchor(const HostPorterSyncAnchor& a, bool more) override {
        anchor = a;
        moreComing = more;
        done.signal();
    }
    void finishEnumeratingWithError(const Error& e) override {
        error = e;
        done.signal();
    }
    std::atomic<size_t> count{0};
    HostPorterSyncAnchor anchor;
    bool moreComing = false;
    std::optional<Error> error;
    DispatchSemaphore done;
};

// The first, middle and last pages of a listing: each the median of ten pages around it, and
// the memory after it.
void printPageSamples(const std::vector<PageSample>& samples) {
    if (samples.size() < 3)
        return;
    auto at = [&](const char* which, size_t center) {
        size_t from = center >= 5 ? center - 5 : 0;
        size_t to = std::min(samples.size(), from + 10);
        from = to >= 10 ? std::min(from, to - 10) : 0;
        std::vector<double> times;
        for (size_t i = from; i < to; ++i) times.push_back(samples[i].seconds);
        std::sort(times.begin(), times.end());
        const Resident& r = samples[center].resident;
        std::printf(
            "  %-6s page %7zu: %8.3f ms (median of pages %zu-%zu), resident %ld KiB, "
            "peak %ld KiB\n",
            which, center + 1, times[times.size() / 2] * 1000, from + 1, to, r.now, r.peak);
    };
    at("first", 0);
    at("middle", samples.size() / 2);
    at("last", samples.size() - 1);
}

void printRow(const char* what, size_t items, double seconds, const char* unit, double baseline,
              const char* baselineWhat) {
    std::printf("%-44s %8zu %9.3f %12.0f %-9s %7.2fx  %s (%.3f s)\n", what, items, seconds,
                items / seconds, unit, seconds / baseline, baselineWhat, baseline);
}

}  // namespace

int main(int argc, char** argv) {
    std::setvbuf(stdout, nullptr, _IOLBF, 0);
    Options options = parseOptions(argc, argv);
    char pattern[4096];
    std::snprintf(pattern, sizeof pattern, "%s/tamber-bench-XXXXXX", options.dir.c_str());
    if (!::mkdtemp(pattern))
        die("can't create a directory under " + options.dir);
    gRoot = pattern;
    std::string storage = gRoot + "/Documents";
    makeDirectory(storage);
    makeDirectory(gRoot + "/state");
    TremorService::configure(gRoot + "/state");

    std::mutex signalMutex;
    std::vector<Clock::time_point> signals;
    HostPorterManager::installDefaultManager(std::make_shared<StorageHostPorterManager>(
        Url::fileURLWithPath(storage), [&](const HostPorterItemIdentifier&) {
            std::lock_guard lock(signalMutex);
            signals.push_back(Clock::now());
        }));

    std::string flat = storage + "/flat";
    std::string tree = storage + "/tree";
    makeDirectory(flat);
    makeDirectory(tree);
    std::fprintf(stderr, "creating %zu files in one folder and %zu in %zu folders\n", options.files,
                 options.tree ? options.files : 0, options.tree ? options.folders : 0);
    for (size_t i = 0; i < options.files; ++i) {
        writeFile(flat + "/f-" + std::to_string(i));
        if ((i + 1) % 100000 == 0)
            std::fprintf(stderr, "  %zu/%zu\n", i + 1, options.files);
    }
    size_t perFolder = std::max<size_t>(1, options.files / options.folders);
    for (size_t k = 0; options.tree && k < options.folders; ++k) {
        std::string folder = tree + "/d-" + std::to_string(k);
        makeDirectory(folder);
        for (size_t i = 0; i < perFolder; ++i) writeFile(folder + "/f-" + std::to_string(i));
    }
    // Watching starts the journal (and its crawl) before anything is timed.
    if (auto status = TremorService::shared().value()->watchTree(storage); !status.ok())
        die("can't watch " + storage + ": " + status.error().description());
    TremorReader::currentEventID();

    std::printf("%-44s %8s %9s %12s %-9s %8s  %s\n", "measure", "items", "seconds", "per second",
                "", "ratio", "baseline (seconds)");
    Url flatURL = Url::fileURLWithPath(flat);
    auto flatID = TBFileObjectIdentifier::itemIdentifier(flatURL);
    if (!flatID)
        die("no identifier for " + flat);

    auto start = Clock::now();
    size_t walked = 0;
    double baseline = 0;
    // The first listing gives every file its document ID; later ones find it.
    size_t listed = 0;
    double seconds = 0;
    for (const char* round :
         {"list a flat folder, first time (IDs made)", "list a flat folder, every page of 200"}) {
        start = Clock::now();
        walked = plainWalk(flat);
        baseline = since(start);
        std::vector<PageSample> samples;
        start = Clock::now();
        listed = listAllPages(*flatID, {flatURL}, &samples);
        seconds = since(start);
        if (listed != walked)
            std::fprintf(stderr, "warning: listed %zu items, the walk saw %zu\n", listed, walked);
        printRow(round, listed, seconds, "items/s", baseline, "getdents+statx+llistxattr walk");
        printPageSamples(samples);
    }
    for (const char* round :
         {"list a tree, first time (IDs made)", "list a tree, every page of 200"}) {
        if (!options.tree)
            break;
        start = Clock::now();
        walked = plainWalk(tree);
        baseline = since(start);
        start = Clock::now();
        listed = listAllPages(HostPorterAllDirectoriesContainerItemIdentifier,
                              {Url::fileURLWithPath(tree)});
        seconds = since(start);
        printRow(round, listed, seconds, "items/s", baseline, "getdents+statx+llistxattr walk");
    }

    // Change enumeration: C new files after an anchor, every batch until caught up.
    // The working set hears of files and folders alike, everywhere under its roots.
    auto enumerator = LocalFileEnumerator::initWithContainer(
        HostPorterWorkingSetContainerItemIdentifier, {Url::fileURLWithPath(storage)});
    std::optional<HostPorterSyncAnchor> anchor;
    DispatchSemaphore anchored;
    enumerator->currentSyncAnchorWithCompletionHandler([&](auto value) {
        anchor = value;
        anchored.signal();
    });
    anchored.wait();
    if (!anchor)
        die("no sync anchor");
    std::string changed = storage + "/changed";
    makeDirectory(changed);
    start = Clock::now();
    for (size_t i = 0; i < options.changes; ++i) writeFile(changed + "/c-" + std::to_string(i));
    double createSeconds = since(start);
    TremorReader::currentEventID();  // journaled before the enumeration starts
    size_t reported = 0;
    size_t batches = 0;
    start = Clock::now();
    for (bool more = true; more; ++batches) {
        auto counter = std::make_shared<ChangeCounter>();
        enumerator->enumerateChangesForObserver(counter, *anchor);
        counter->done.wait();
        if (counter->error)
            die("change enumeration failed: " + counter->error->description());
        reported += counter->count;
        anchor = counter->anchor;
        more = counter->moreComing;
    }
    seconds = since(start);
    enumerator->invalidate();
    printRow("change enumeration, every batch", reported, seconds, "changes/s", createSeconds,
             "creating the files");
    std::printf("  (%zu batches for %zu files created)\n", batches, options.changes);

    // Notifier delay: a write, then the signal; the stream's latency (0.5 s) is part of it.
    auto notifier = FSChangesNotifier::make(HostPorterRootContainerItemIdentifier,
                                            {Url::fileURLWithPath(storage)});
    if (!notifier)
        die("no notifier");
    notifier->start();
    std::this_thread::sleep_for(std::chrono::milliseconds(700));
    std::vector<double> delays;
    for (int i = 0; i < 10; ++i) {
        size_t before;
        {
            std::lock_guard lock(signalMutex);
            before = signals.size();
        }
        auto written = Clock::now();
        writeFile(storage + "/signal-" + std::to_string(i));
        for (;;) {
            std::this_thread::sleep_for(std::chrono::milliseconds(2));
            std::lock_guard lock(signalMutex);
            if (signals.size() > before) {
                delays.push_back(std::chrono::duration<double>(signals[before] - written).count());
                break;
            }
            if (since(written) > 5)
                die("no signal within 5 s of a write");
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(600));
    }
    notifier->stop();
    std::sort(delays.begin(), delays.end());
    std::printf("write to notifier signal: median %.3f s, max %.3f s (stream latency 0.5 s)\n",
                delays[delays.size() / 2], delays.back());
    std::printf("ratio: seconds against the baseline's seconds for the same files\n");
    cleanUp();
    return 0;
}
