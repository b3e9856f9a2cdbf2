#include "server/DesktopThumbnails.h"

#include <fcntl.h>
#include <glib.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <optional>

#include "platform/FileSystem.h"
#include "support/Log.h"
#include "support/RandomToken.h"

namespace tamber {

namespace {

constexpr const char* kUriKey = "Thumb::URI";
constexpr const char* kMTimeKey = "Thumb::MTime";
// A cached thumbnail larger than this is not one of ours, nor any file manager's.
constexpr size_t kMaxCachedBytes = 16 << 20;

Error sourceTooLarge() {
    return Error(kPosixErrorDomain, EFBIG,
                 {{"description", "the file is too large to make a thumbnail of (over 64 MiB)"}});
}

// Reads up to `limit` bytes of `fd` from its start; more than that is EFBIG.
Result<Bytes> readUpTo(int fd, size_t limit) {
    FileSystem& fs = FileSystem::current();
    Bytes bytes;
    char buffer[64 * 1024];
    for (;;) {
        ssize_t n = fs.pread(fd, buffer, sizeof buffer, static_cast<off_t>(bytes.size()));
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return Error::posix(errno);
        if (n == 0)
            return bytes;
        if (bytes.size() + size_t(n) > limit)
            return Error::posix(EFBIG);
        bytes.insert(bytes.end(), buffer, buffer + n);
    }
}

uint32_t bigEndian32(const uint8_t* p) {
    return uint32_t(p[0]) << 24 | uint32_t(p[1]) << 16 | uint32_t(p[2]) << 8 | uint32_t(p[3]);
}

void appendBigEndian32(Bytes& out, uint32_t value) {
    for (int shift = 24; shift >= 0; shift -= 8) out.push_back(uint8_t(value >> shift));
}

uint32_t pngChunkCrc(const uint8_t* data, size_t length) {
    uint32_t crc = 0xffffffffu;
    for (size_t i = 0; i < length; ++i) {
        crc ^= data[i];
        for (int bit = 0; bit < 8; ++bit) crc = (crc >> 1) ^ (0xedb88320u & (0u - (crc & 1)));
    }
    return ~crc;
}

void appendChunk(Bytes& png, const std::string& type, const Bytes& data) {
    appendBigEndian32(png, uint32_t(data.size()));
    const size_t start = png.size();
    png.insert(png.end(), type.begin(), type.end());
    png.insert(png.end(), data.begin(), data.end());
    appendBigEndian32(png, pngChunkCrc(&png[start], png.size() - start));
}

// The failure marker: a 1-pixel grey PNG carrying the text chunks.
Bytes failureMarker(const std::map<std::string, std::string>& text) {
    Bytes png = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1a, '\n'};
    appendChunk(png, "IHDR", {0, 0, 0, 1, 0, 0, 0, 1, 8, 0, 0, 0, 0});
    for (const auto& [key, value] : text) {
        Bytes chunk(key.begin(), key.end());
        chunk.push_back(0);
        chunk.insert(chunk.end(), value.begin(), value.end());
        appendChunk(png, "tEXt", chunk);
    }
    // A zlib stream of one stored block holding the row: filter 0, pixel 0.
    appendChunk(png, "IDAT",
                {0x78, 0x01, 0x01, 0x02, 0x00, 0xfd, 0xff, 0x00, 0x00, 0x00, 0x02, 0x00, 0x01});
    appendChunk(png, "IEND", {});
    return png;
}

// Creates each missing folder of `path` (absolute), private to the user.
Status makeFolders(const std::string& path) {
    FileSystem& fs = FileSystem::current();
    for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
        const std::string prefix = path.substr(0, slash);
        if (fs.mkdir(prefix, 0700) != 0 && errno != EEXIST)
            return Error::posix(errno);
        if (slash == std::string::npos)
            return Status::OK();
    }
}

}  // namespace

const char* const DesktopThumbnails::kFailureFolder = TAMBER_THUMBNAILER;

struct DesktopThumbnails::Job {
    std::string folder;  // normal/ or large/ of the cache
    std::string name;    // <md5>.png
    std::string uri;
    int64_t mtime = 0;
    int edge = 0;
    ScopedFd file;
    std::optional<Result<Bytes>> result;  // set once; guarded by the object's mutex
    std::condition_variable finished;
};

std::string DesktopThumbnails::defaultCacheFolder() {
    // Read with getenv rather than GLib's helpers, which cache the environment for the life of
    // the process.
    if (const char* cache = std::getenv("XDG_CACHE_HOME"); cache && *cache == '/')
        return std::string(cache) + "/thumbnails";
    const char* home = std::getenv("HOME");
    return std::string(home && *home ? home : "/tmp") + "/.cache/thumbnails";
}

std::string DesktopThumbnails::uriForPath(const std::string& absolutePath) {
    // GLib's encoding is the one the desktop's file managers name their thumbnails by.
    gchar* uri = g_filename_to_uri(absolutePath.c_str(), nullptr, nullptr);
    if (!uri)
        return {};
    std::string text(uri);
    g_free(uri);
    return text;
}

std::string DesktopThumbnails::cacheNameForUri(const std::string& uri) {
    gchar* md5 = g_compute_checksum_for_string(G_CHECKSUM_MD5, uri.c_str(), gssize(uri.size()));
    std::string name = std::string(md5) + ".png";
    g_free(md5);
    return name;
}

std::map<std::string, std::string> DesktopThumbnails::pngText(const Bytes& png) {
    static constexpr uint8_t kSignature[] = {0x89, 'P', 'N', 'G', '\r', '\n', 0x1a, '\n'};
    std::map<std::string, std::string> text;
    if (png.size() < sizeof kSignature || !std::equal(kSignature, kSignature + 8, png.begin()))
        return text;
    size_t at = sizeof kSignature;
    while (png.size() - at >= 12) {
        const uint32_t length = bigEndian32(&png[at]);
        const std::string type(png.begin() + long(at) + 4, png.begin() + long(at) + 8);
        if (length > png.size() - at - 12)
            return {};  // cut short: trust none of it
        const uint8_t* data = &png[at + 8];
        if (type == "tEXt") {
            const auto* end = data + length;
            const auto* nul = std::find(data, end, uint8_t(0));
            if (nul != end)
                text.emplace(std::string(data, nul), std::string(nul + 1, end));
        }
        if (type == "IEND")
            break;
        at += 12 + length;
    }
    return text;
}

DesktopThumbnails::DesktopThumbnails(Options options) : options_(std::move(options)) {
    for (int i = 0; i < std::max(1, options_.workers); ++i)
        threads_.emplace_back([this] { work(); });
}

DesktopThumbnails::~DesktopThumbnails() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
        for (auto& job : queue_) {
            job->result = Error::posix(ECANCELED);
            job->finished.notify_all();
        }
        queue_.clear();
    }
    wake_.notify_all();
    for (auto& thread : threads_) thread.join();
}

std::string DesktopThumbnails::failureFolder() const {
    return options_.cacheFolder + "/fail/" + kFailureFolder;
}

size_t DesktopThumbnails::queuedForTesting() const {
    std::lock_guard lock(mutex_);
    return queue_.size();
}

size_t DesktopThumbnails::waitingForTesting() const {
    std::lock_guard lock(mutex_);
    return waiting_;
}

Result<Bytes> DesktopThumbnails::thumbnail(const std::string& path, ScopedFd file, int size) {
    struct statx st {};
    if (FileSystem::current().statx(file.get(), "", AT_EMPTY_PATH,
                                    STATX_TYPE | STATX_SIZE | STATX_MTIME, &st) != 0)
        return Error::posix(errno);
    if (!S_ISREG(st.stx_mode))
        return Error::posix(EINVAL);
    const std::string uri = uriForPath(path);
    if (uri.empty())
        return Error::posix(EINVAL);
    auto job = std::make_shared<Job>();
    const bool large = size > kNormalEdge;
    job->folder = options_.cacheFolder + (large ? "/large" : "/normal");
    job->name = cacheNameForUri(uri);
    job->uri = uri;
    job->mtime = st.stx_mtime.tv_sec;
    job->edge = large ? kLargeEdge : kNormalEdge;

    if (auto hit = cached(job->folder + "/" + job->name, uri, job->mtime); hit.ok())
        return hit;
    if (cached(failureFolder() + "/" + job->name, uri, job->mtime).ok())
        return Error(kPosixErrorDomain, EBADMSG,
                     {{"description", "the file is not an image that can be read"}});
    if (st.stx_size > kMaxSourceBytes)
        return sourceTooLarge();
    job->file = std::move(file);

    std::unique_lock lock(mutex_);
    if (stopping_)
        return Error::posix(ECANCELED);
    const std::string key = job->folder + "/" + job->name;
    if (auto same = running_.find(key);
        same != running_.end() && same->second->mtime == job->mtime) {
        job = same->second;  // already being made: wait for that one
    } else {
        running_[key] = job;
        queue_.push_back(job);
        wake_.notify_one();
    }
    const auto deadline = std::chrono::steady_clock::now() +
                          std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                              std::chrono::duration<double>(options_.patience));
    ++waiting_;
    const bool finished =
        job->finished.wait_until(lock, deadline, [&] { return job->result.has_value(); });
    --waiting_;
    if (!finished)
        return Error(kPosixErrorDomain, ETIMEDOUT,
                     {{"description", "the thumbnail is taking too long to make"}});
    return *job->result;
}

Result<Bytes> DesktopThumbnails::cached(const std::string& file, const std::string& uri,
                                        int64_t mtime) const {
    FileSystem& fs = FileSystem::current();
    ScopedFd fd(fs.open(file, O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
    if (!fd.ok())
        return Error::posix(errno);
    auto png = readUpTo(fd.get(), kMaxCachedBytes);
    if (!png.ok())
        return png.error();
    auto text = pngText(png.value());
    if (text[kUriKey] != uri || text[kMTimeKey] != std::to_string(mtime))
        return Error::posix(ESTALE);
    return png;
}

void DesktopThumbnails::work() {
    for (;;) {
        std::shared_ptr<Job> job;
        {
            std::unique_lock lock(mutex_);
            wake_.wait(lock, [this] { return stopping_ || !queue_.empty(); });
            if (stopping_)
                return;
            job = queue_.front();
            queue_.pop_front();
        }
        auto made = renderAndStore(*job);
        std::lock_guard lock(mutex_);
        job->result = std::move(made);
        job->file.reset();
        if (auto it = running_.find(job->folder + "/" + job->name);
            it != running_.end() && it->second == job)
            running_.erase(it);
        job->finished.notify_all();
    }
}

Result<Bytes> DesktopThumbnails::renderAndStore(const Job& job) const {
    auto source = readUpTo(job.file.get(), kMaxSourceBytes);
    if (!source.ok())
        return source.error().is(kPosixErrorDomain, EFBIG) ? sourceTooLarge() : source.error();
    auto png = options_.renderer->render(
        source.value(), job.edge,
        {{kUriKey, job.uri}, {kMTimeKey, std::to_string(job.mtime)}, {"Software", "Tamber"}});
    if (!png.ok()) {
        if (png.error().is(kPosixErrorDomain, EBADMSG))
            store(failureFolder(), job.name,
                  failureMarker({{kUriKey, job.uri}, {kMTimeKey, std::to_string(job.mtime)}}));
        return png.error();
    }
    store(job.folder, job.name, png.value());
    return png;
}

void DesktopThumbnails::store(const std::string& folder, const std::string& name,
                              const Bytes& png) const {
    // The cache is shared and best-effort: a thumbnail that cannot be stored is still served.
    FileSystem& fs = FileSystem::current();
    if (auto made = makeFolders(folder); !made.ok()) {
        logError("thumbnail cache " + folder + ": " + made.error().description());
        return;
    }
    const std::string temporary = folder + "/." + name + "." + RandomToken::hex(8) + ".tmp";
    ScopedFd fd(fs.open(temporary, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
    if (!fd.ok()) {
        logError("thumbnail cache " + temporary + ": " + Error::posix(errno).description());
        return;
    }
    size_t done = 0;
    while (done < png.size()) {
        ssize_t n = fs.write(fd.get(), png.data() + done, png.size() - done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            logError("thumbnail cache " + temporary + ": " + Error::posix(errno).description());
            fd.reset();
            fs.unlinkat(AT_FDCWD, temporary, 0);
            return;
        }
        done += size_t(n);
    }
    fd.reset();
    if (fs.renameat2(AT_FDCWD, temporary, AT_FDCWD, folder + "/" + name, 0) != 0) {
        logError("thumbnail cache " + name + ": " + Error::posix(errno).description());
        fs.unlinkat(AT_FDCWD, temporary, 0);
    }
}

}  // namespace tamber
