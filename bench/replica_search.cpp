// Measures search over the host's replica: loads N items (names drawn from a few words and
// numbers, a tenth tagged, a few types) in one listing, then runs each kind of query many times
// and prints the median and the 99th percentile.
//
//   build/bench/bench_replica_search [items=100000] [dir=$TMPDIR]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/Tag.h"
#include "server/ReplicaStore.h"

using namespace tamber;
using Clock = std::chrono::steady_clock;

namespace {

struct BenchItem : HostPorterItem {
    std::string id, name, type;
    bool tagged = false;
    HostPorterItemIdentifier itemIdentifier() const override { return id; }
    HostPorterItemIdentifier parentItemIdentifier() const override { return "fid=1"; }
    std::string filename() const override { return name; }
    std::string typeIdentifier() const override { return type; }
    HostPorterItemCapabilities capabilities() const override { return 0x3F; }
    std::optional<Bytes> tagData() const override {
        if (!tagged)
            return std::nullopt;
        return GetTagsDataForTags({Tag::make("Work")});
    }
    std::string description() const override { return id; }
};

[[noreturn]] void die(const std::string& what) {
    std::fprintf(stderr, "%s\n", what.c_str());
    std::exit(1);
}

}  // namespace

int main(int argc, char** argv) {
    const size_t count = argc > 1 ? std::strtoul(argv[1], nullptr, 10) : 100000;
    const char* tmp = std::getenv("TMPDIR");
    std::filesystem::path dir = argc > 2 ? argv[2] : (tmp ? tmp : "/tmp");
    dir /= "bench-replica-" + std::to_string(::getpid());
    std::filesystem::create_directories(dir);

    auto opened = ReplicaStore::open((dir / "replica.db").string());
    if (!opened.ok())
        die(opened.error().description());
    auto& store = *opened.value();
    const char* words[] = {"report", "holiday", "invoice", "notes", "draft", "photo", "budget"};
    const char* types[][2] = {{".txt", "public.plain-text"},
                              {".png", "public.png"},
                              {".jpg", "public.jpeg"},
                              {".pdf", "com.adobe.pdf"}};
    std::vector<HostPorterItemRef> items;
    for (size_t i = 0; i < count; ++i) {
        auto item = std::make_shared<BenchItem>();
        item->id = "did=" + std::to_string(i + 2);
        const auto& type = types[i % 4];
        item->name = std::string(words[i % 7]) + " " + std::to_string(i) + type[0];
        item->type = type[1];
        item->tagged = i % 10 == 0;
        items.push_back(std::move(item));
    }
    auto start = Clock::now();
    std::string anchor = "anchor";
    if (!store.replaceAll(items, HostPorterSyncAnchor(anchor.begin(), anchor.end())).ok())
        die("replace failed");
    std::printf("listing of %zu items stored in %.2f s\n", count,
                std::chrono::duration<double>(Clock::now() - start).count());

    struct Case {
        const char* name;
        ReplicaSearchQuery query;
    };
    auto q = [](std::string text) {
        ReplicaSearchQuery query;
        query.text = std::move(text);
        return query;
    };
    std::vector<Case> cases{{"common word \"report\"", q("report")},
                            {"rare \"12345\"", q("12345")},
                            {"absent \"zzzz\"", q("zzzz")},
                            {"short \"ho\"", q("ho")},
                            {"everything", q("")}};
    auto image = q("");
    image.type = "public.image";
    cases.push_back({"type public.image", image});
    auto tagged = q("draft");
    tagged.tag = "Work";
    cases.push_back({"\"draft\" tagged Work", tagged});

    for (const auto& c : cases) {
        std::vector<double> ms;
        size_t found = 0;
        for (int run = 0; run < 200; ++run) {
            auto t = Clock::now();
            auto result = store.search(c.query);
            ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t).count());
            if (!result.ok())
                die(result.error().description());
            found = result->size();
        }
        std::sort(ms.begin(), ms.end());
        std::printf("%-24s %4zu found   median %7.2f ms   p99 %7.2f ms\n", c.name, found,
                    ms[ms.size() / 2], ms[ms.size() * 99 / 100]);
    }
    opened.value().reset();
    std::filesystem::remove_all(dir);
}
