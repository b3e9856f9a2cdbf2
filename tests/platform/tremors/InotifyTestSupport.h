#pragma once

#include <sys/inotify.h>

#include <cstdint>
#include <cstring>
#include <ostream>
#include <string>
#include <vector>

#include "platform/tremors/FileChange.h"

namespace tamber {

// Readable failure messages for change lists.
inline void PrintTo(const FileChange& change, std::ostream* os) {
    *os << FileChange::kindName(change.kind) << "(";
    if (change.kind == FileChange::Kind::Renamed)
        *os << change.fromPath << " -> ";
    *os << change.path << (change.isDirectory ? ", dir" : "");
    if (change.error != 0)
        *os << ", errno " << change.error;
    *os << ")";
}

namespace testing {

inline FileChange makeChange(FileChange::Kind kind, std::string path, bool isDirectory = false,
                             int error = 0) {
    FileChange change;
    change.kind = kind;
    change.path = std::move(path);
    change.isDirectory = isDirectory;
    change.error = error;
    return change;
}
inline FileChange created(std::string path, bool isDirectory = false) {
    return makeChange(FileChange::Kind::Created, std::move(path), isDirectory);
}
inline FileChange removed(std::string path, bool isDirectory = false) {
    return makeChange(FileChange::Kind::Removed, std::move(path), isDirectory);
}
inline FileChange modified(std::string path, bool isDirectory = false) {
    return makeChange(FileChange::Kind::Modified, std::move(path), isDirectory);
}
inline FileChange attributes(std::string path, bool isDirectory = false) {
    return makeChange(FileChange::Kind::AttributesChanged, std::move(path), isDirectory);
}
inline FileChange renamed(std::string from, std::string to, bool isDirectory = false) {
    FileChange change = makeChange(FileChange::Kind::Renamed, std::move(to), isDirectory);
    change.fromPath = std::move(from);
    return change;
}
inline FileChange overflow() {
    return makeChange(FileChange::Kind::Overflow, {});
}
inline FileChange watchFailed(std::string path, int error) {
    return makeChange(FileChange::Kind::WatchFailed, std::move(path), true, error);
}

// Builds event records laid out as the kernel lays them out: the name NUL-padded to a multiple
// of the header size.
class EventBuffer {
public:
    EventBuffer& add(int wd, uint32_t mask, std::string name = {}, uint32_t cookie = 0) {
        uint32_t len = 0;
        if (!name.empty()) {
            const size_t unit = sizeof(struct inotify_event);
            len = static_cast<uint32_t>((name.size() + 1 + unit - 1) / unit * unit);
        }
        name.resize(len, '\0');
        return addRaw(wd, mask, cookie, len, name);
    }
    // A header with an explicit length field, consistent or not, followed by `payload` as is.
    EventBuffer& addRaw(int wd, uint32_t mask, uint32_t cookie, uint32_t len,
                        const std::string& payload) {
        struct inotify_event header {};
        header.wd = wd;
        header.mask = mask;
        header.cookie = cookie;
        header.len = len;
        bytes_.append(reinterpret_cast<const char*>(&header), sizeof header);
        bytes_.append(payload);
        ends_.push_back(bytes_.size());
        return *this;
    }

    const std::string& bytes() const { return bytes_; }
    // Where each record ends.
    const std::vector<size_t>& recordEnds() const { return ends_; }

private:
    std::string bytes_;
    std::vector<size_t> ends_;
};

}  // namespace testing
}  // namespace tamber
