#pragma once

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/ScopedFd.h"
#include "platform/imaging/ThumbnailRenderer.h"
#include "platform/objects/Data.h"
#include "support/Result.h"

namespace tamber {

// Thumbnails of image files, kept in the desktop's shared thumbnail cache so that the file
// managers of the desktop reuse what Tamber made and Tamber reuses theirs:
//   <cache>/normal/<md5>.png  (at most 128 pixels a side)  and  <cache>/large/<md5>.png (256),
// where <md5> is the lowercase hex MD5 of the file's URI (file:// and the percent-encoded
// absolute path), each PNG carrying the text chunks Thumb::URI and Thumb::MTime (seconds).
// A cached thumbnail is valid while its Thumb::URI is the file's and its Thumb::MTime the
// file's modification time; a missing or stale one is rendered and stored atomically (a
// private temporary file renamed into place; files 0600, folders 0700).
//
// Rendering runs on the object's own worker threads, never the caller's, at most `workers` at
// a time; a caller waits for its own thumbnail up to `patience` seconds. Two callers asking
// for the same thumbnail at once share one rendering. Thread-safe.
class DesktopThumbnails {
public:
    static constexpr uint64_t kMaxSourceBytes = 64ull << 20;
    static constexpr int kNormalEdge = 128;
    static constexpr int kLargeEdge = 256;
    // Under <cache>/fail/: a file that could not be rendered is marked there, by the same name,
    // with a 1-pixel PNG carrying its Thumb::URI and Thumb::MTime, and not tried again while
    // its mtime stays the same.
    static const char* const kFailureFolder;

    struct Options {
        std::string cacheFolder;  // the "thumbnails" folder; see defaultCacheFolder()
        std::shared_ptr<ThumbnailRenderer> renderer;
        int workers = 2;
        double patience = 30;
    };

    // $XDG_CACHE_HOME/thumbnails, or ~/.cache/thumbnails.
    static std::string defaultCacheFolder();
    // The file's URI as the thumbnail cache names it, and that name.
    static std::string uriForPath(const std::string& absolutePath);
    static std::string cacheNameForUri(const std::string& uri);
    // The tEXt chunks of a PNG file (keyword to text); empty for anything else.
    static std::map<std::string, std::string> pngText(const Bytes& png);

    explicit DesktopThumbnails(Options options);
    ~DesktopThumbnails();
    DesktopThumbnails(const DesktopThumbnails&) = delete;
    DesktopThumbnails& operator=(const DesktopThumbnails&) = delete;

    // The PNG thumbnail of the regular file open as `file` whose absolute path is `path`, for a
    // requested `size` (up to 128 gives the normal size, anything larger the large one).
    // A file over kMaxSourceBytes is never rendered (a valid thumbnail another program made
    // for it is still served). Errors: EFBIG for such a file without one, EBADMSG for one that is
    // not a readable image, ETIMEDOUT when rendering took longer than the patience, ECANCELED when
    // the object is being destroyed; file-system errors as they come.
    Result<Bytes> thumbnail(const std::string& path, ScopedFd file, int size);

    // Renderings waiting for a worker, and callers waiting for a rendering. Tests only.
    size_t queuedForTesting() const;
    size_t waitingForTesting() const;

private:
    struct Job;

    std::string failureFolder() const;
    Result<Bytes> cached(const std::string& file, const std::string& uri, int64_t mtime) const;
    void work();
    Result<Bytes> renderAndStore(const Job& job) const;
    void store(const std::string& folder, const std::string& name, const Bytes& png) const;

    const Options options_;
    mutable std::mutex mutex_;
    std::condition_variable wake_;
    std::deque<std::shared_ptr<Job>> queue_;               // guarded by mutex_
    std::map<std::string, std::shared_ptr<Job>> running_;  // by cache file; guarded by mutex_
    size_t waiting_ = 0;                                   // guarded by mutex_
    bool stopping_ = false;                                // guarded by mutex_
    std::vector<std::thread> threads_;
};

}  // namespace tamber
