#pragma once

#include <cstddef>
#include <list>
#include <memory>
#include <optional>

#include "platform/DirectoryStamp.h"
#include "platform/FileSystem.h"
#include "support/Mutex.h"
#include "support/MutexLock.h"

namespace tamber {

// Values read from directories, each kept under the stamp the directory had when it was read
// and handed out only while the directory still has that stamp, on the same file system.
// Bounded by a number of directories and a total weight (what `weigh` says a value costs); the
// least recently used goes first, but the newest always stays. Safe to use from several threads.
template <class Value>
class StampedDirectoryCache {
public:
    using Weigh = size_t (*)(const Value&);

    StampedDirectoryCache(size_t maxDirectories, size_t maxWeight, Weigh weigh)
        : maxDirectories_(maxDirectories), maxWeight_(maxWeight), weigh_(weigh) {}
    StampedDirectoryCache(const StampedDirectoryCache&) = delete;
    StampedDirectoryCache& operator=(const StampedDirectoryCache&) = delete;

    // The value kept for the directory of `stamp` on `fs` while its stamp is unchanged; a value
    // kept under an older stamp is dropped.
    std::optional<Value> find(const FileSystem* fs, const DirectoryStamp& stamp) {
        MutexLock lock(mutex_);
        for (auto it = kept_.begin(); it != kept_.end(); ++it) {
            if (it->fileSystem != fs || !it->stamp.sameDirectory(stamp))
                continue;
            if (it->stamp != stamp || it->fileSystemAlive.expired()) {
                weight_ -= weigh_(it->value);
                kept_.erase(it);
                return std::nullopt;
            }
            kept_.splice(kept_.begin(), kept_, it);
            return kept_.front().value;
        }
        return std::nullopt;
    }

    // Keeps `value`, read from the directory of `stamp` on `fs`, in place of any value kept
    // for that directory.
    void keep(const std::shared_ptr<FileSystem>& fs, const DirectoryStamp& stamp, Value value) {
        if (maxDirectories_ == 0)
            return;
        MutexLock lock(mutex_);
        // Another thread may have read the same directory meanwhile.
        for (auto it = kept_.begin(); it != kept_.end(); ++it) {
            if (it->fileSystem == fs.get() && it->stamp.sameDirectory(stamp)) {
                weight_ -= weigh_(it->value);
                kept_.erase(it);
                break;
            }
        }
        weight_ += weigh_(value);
        kept_.push_front(Kept{fs.get(), fs, stamp, std::move(value)});
        while (kept_.size() > 1 && (kept_.size() > maxDirectories_ || weight_ > maxWeight_)) {
            weight_ -= weigh_(kept_.back().value);
            kept_.pop_back();
        }
    }

    void clear() {
        MutexLock lock(mutex_);
        kept_.clear();
        weight_ = 0;
    }

    size_t size() const {
        MutexLock lock(mutex_);
        return kept_.size();
    }

private:
    struct Kept {
        const FileSystem* fileSystem;
        std::weak_ptr<FileSystem> fileSystemAlive;
        DirectoryStamp stamp;
        Value value;
    };

    const size_t maxDirectories_;
    const size_t maxWeight_;
    const Weigh weigh_;
    mutable Mutex mutex_;
    std::list<Kept> kept_ GUARDED_BY(mutex_);  // most recently used first
    size_t weight_ GUARDED_BY(mutex_) = 0;
};

}  // namespace tamber
