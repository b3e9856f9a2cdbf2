// Reads the user metadata of every file in a freshly built tree and compares the cost with a
// plain statx loop over the same files, and with reading the five attributes one by one.
//
//   build/bench/bench_metadata_read [files=20000] [dir=$TMPDIR]
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "items/ItemMetadata.h"
#include "items/LocalItem.h"

using namespace tamber;
using Clock = std::chrono::steady_clock;

namespace {

template <class F>
double secondsFor(const std::vector<std::string>& paths, F&& perPath) {
    auto start = Clock::now();
    for (const auto& p : paths) perPath(p);
    return std::chrono::duration<double>(Clock::now() - start).count();
}

}  // namespace

int main(int argc, char** argv) {
    size_t count = argc > 1 ? std::strtoul(argv[1], nullptr, 10) : 20000;
    const char* tmp = argc > 2 ? argv[2] : (std::getenv("TMPDIR") ? std::getenv("TMPDIR") : "/tmp");
    std::string root = std::string(tmp) + "/tamber-bench-XXXXXX";
    if (!mkdtemp(root.data()))
        return 1;

    std::fprintf(stderr, "building %zu files under %s...\n", count, root.c_str());
    std::vector<std::string> paths;
    paths.reserve(count);
    for (size_t i = 0; i < count; ++i) {
        std::string dir = root + "/d" + std::to_string(i / 1000);
        if (i % 1000 == 0)
            mkdir(dir.c_str(), 0755);
        paths.push_back(dir + "/file-" + std::to_string(i) + ".txt");
        int fd = open(paths.back().c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0644);
        if (fd < 0)
            return 1;
        close(fd);
        // A quarter of the files carry metadata, as a used library would.
        if (i % 4 == 0) {
            Url url = Url::fileURLWithPath(paths.back());
            ItemMetadata::writeLastUsedDate(url, Date::make(1.7e9 + double(i)));
            ItemMetadata::writeTagData(url, ItemMetadata::tagDataForLabels({"Work"}));
        }
    }

    size_t seen = 0;
    double baseline = secondsFor(paths, [&](const std::string& p) {
        struct statx st {};
        seen += statx(AT_FDCWD, p.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS, &st) == 0;
    });
    const std::string names[] = {LocalItem::xattrLastUsedDateName(), LocalItem::xattrTagDataName(),
                                 LocalItem::xattrFavoriteRankName(),
                                 LocalItem::xattrTrashDateName(),
                                 LocalItem::xattrTrashPutBackName()};
    double fiveReads = secondsFor(paths, [&](const std::string& p) {
        char buf[512];
        for (const auto& n : names)
            seen += lgetxattr(p.c_str(), ("user." + n).c_str(), buf, 512) > 0;
    });
    double metadata = secondsFor(paths, [&](const std::string& p) {
        ItemMetadata m = ItemMetadata::read(Url::fileURLWithPath(p));
        seen += m.lastUsedDate ? 1 : 0;
    });

    auto report = [&](const char* what, double seconds) {
        std::printf("%-32s %9.0f items/s  %6.2f us/item  %5.2fx baseline\n", what,
                    double(count) / seconds, seconds * 1e6 / double(count), seconds / baseline);
    };
    report("statx loop (baseline)", baseline);
    report("five raw lgetxattr", fiveReads);
    report("ItemMetadata::read (decoded)", metadata);
    std::printf("(checksum %zu)\n", seen);
    std::filesystem::remove_all(root);
    return 0;
}
