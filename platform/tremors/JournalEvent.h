#pragma once

#include <cstdint>
#include <string>

namespace tamber {

// One journaled file-system event. The store assigns `id` when the event is appended.
struct JournalEvent {
    uint64_t id = 0;
    std::string path;     // absolute, without a trailing slash
    uint64_t fileID = 0;  // the inode when known, else 0
    uint32_t flags = 0;

    friend bool operator==(const JournalEvent&, const JournalEvent&) = default;
};

}  // namespace tamber
