// Feeds arbitrary bytes to the sync-anchor and page-token decoder. A token that decodes must
// encode back to a token equal to it, and never to (nor from) one of the two fixed first pages
// a listing starts from; its event ID, whatever its value, must lead to a
// replay decision and a replay that end: nothing at or before the ID, nothing past the
// journal's last event, and a replay from past the end judged incomplete.
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "fs/FSChangeToken.h"
#include "host/HostPorterPage.h"
#include "platform/tremors/TremorStore.h"
#include "support/Log.h"

using namespace tamber;

namespace {

constexpr int kEvents = 60;

struct Journal {
    std::string dir;
    std::unique_ptr<TremorStore> store;
    uint64_t last = 0;
};

Journal* journal = nullptr;

void closeJournal() {
    journal->store.reset();
    std::filesystem::remove_all(journal->dir);
}

// A journal with a trimmed start and two roots, one of them watched late.
Journal& openJournal() {
    if (journal)
        return *journal;
    char pattern[] = "/tmp/tamber-fuzz-token-XXXXXX";
    if (!::mkdtemp(pattern))
        std::abort();
    journal = new Journal{pattern, nullptr, 0};
    auto store = TremorStore::open(journal->dir, 0x70c3);
    if (!store.ok())
        std::abort();
    journal->store = std::move(store).value();
    std::atexit(closeJournal);
    TremorStore& s = *journal->store;
    if (!s.addRoot("/w", 0).ok())
        std::abort();
    std::vector<JournalEvent> events;
    for (int i = 0; i < kEvents; ++i)
        events.push_back(
            {0, (i % 3 ? "/w/f" : "/x/f") + std::to_string(i), uint64_t(i + 1), 0x100});
    auto appended = s.append(events);
    if (!appended.ok() || !s.addRoot("/x", 20).ok() || !s.trim(kEvents - 10).ok())
        std::abort();
    journal->last = appended.value();
    return *journal;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static bool quiet = [] {
        Log::shared().setDebugEnabled(false);
        return true;
    }();
    (void)quiet;
    const Bytes input(data, data + size);
    auto token = FSChangeToken::decode(input);
    if (!token)
        return 0;
    const Bytes encoded = token->encode();
    auto again = FSChangeToken::decode(encoded);
    if (!again || !(*again == *token) || isHostPorterInitialPage(input) ||
        isHostPorterInitialPage(encoded))
        std::abort();

    Journal& j = openJournal();
    const uint64_t since = token->streamEventID;
    // The offset picks the paths and the chunk size, so that both vary with the input.
    std::vector<std::string> paths;
    if (token->offset & 1)
        paths.push_back("/w");
    if (token->offset & 2)
        paths.push_back("/x");
    const size_t chunk = 1 + token->offset % 7;
    TremorStore::ReplayCheck check = j.store->replayability(since, paths);
    if (since > j.last && check.complete)
        std::abort();
    uint64_t seen = 0;
    uint64_t previous = since;
    Status status = j.store->replay(since, paths, chunk, [&](const JournalEvent& event) {
        if (event.id <= previous || event.id > j.last || ++seen > kEvents)
            std::abort();
        previous = event.id;
        return true;
    });
    if (!status.ok() || (since >= j.last && seen != 0))
        std::abort();
    return 0;
}
