#include "server/ContentRoutes.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <charconv>
#include <mutex>
#include <optional>
#include <vector>

#include "host/ItemNames.h"
#include "host/PublishedTrees.h"
#include "host/StagedFile.h"
#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "platform/TypeIdentifiers.h"
#include "runtime/HostJson.h"
#include "server/ApiReply.h"
#include "server/ByteRange.h"
#include "server/ContentTypes.h"
#include "server/DesktopThumbnails.h"
#include "support/DispatchSemaphore.h"

namespace tamber {

namespace {

constexpr const char* kContentPath = R"(/api/v1/items/([^/]+)/content)";
constexpr const char* kThumbnailPath = R"(/api/v1/items/([^/]+)/thumbnail)";
constexpr const char* kChildrenUploadPath = R"(/api/v1/containers/([^/]+)/children)";

constexpr size_t kReadChunk = 64 * 1024;
constexpr size_t kMaxUploadNameBytes = 255;
constexpr int kMinThumbnail = 16;
constexpr int kMaxThumbnail = 1024;
constexpr int kDefaultThumbnail = 256;
// Thumbnails are made on the provider's threads; a request never waits longer than this.
constexpr double kThumbnailPatience = 30;
constexpr std::string_view kImageType = "public.image";

Error notAFile() {
    return ApiReply::badRequest("only a file has content");
}

// The item's path, for an identifier the provider knows.
Result<Url> contentItemURL(ApiContext& context, const std::string& identifier) {
    auto url = context.provider->URLForItemWithPersistentIdentifier(identifier);
    if (!url)
        return Error::porterErrorForNonExistentItemWithIdentifier(identifier);
    return *url;
}

// A regular file of the published trees, opened for reading without following a link.
struct OpenFile {
    ScopedFd fd;
    uint64_t size = 0;
    mode_t mode = 0;
};

Result<OpenFile> openRegularFile(const Url& url, int flags) {
    auto root = PublishedTrees::rootOf(url);
    if (root && root->path() == url.path())
        return notAFile();  // a root is a folder
    auto parent = PublishedTrees::openParent(url, O_PATH);
    if (!parent.ok())
        return parent.error();
    FileSystem& fs = FileSystem::current();
    ScopedFd folder(parent.value().fd);
    // O_NONBLOCK: a pipe under the name must not hang the request; it is refused below.
    ScopedFd fd(
        fs.openat(folder.get(), parent.value().name, flags | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    if (!fd.ok())
        return errno == ELOOP ? notAFile() : Error::posix(errno);
    struct statx st {};
    if (fs.statx(fd.get(), "", AT_EMPTY_PATH, STATX_TYPE | STATX_MODE | STATX_SIZE, &st) != 0)
        return Error::posix(errno);
    if (!S_ISREG(st.stx_mode))
        return notAFile();
    OpenFile file;
    file.fd = std::move(fd);
    file.size = st.stx_size;
    file.mode = st.stx_mode & 07777;
    return file;
}

// The library parses `Range` itself and slices whatever a handler answers by it (an error
// body too, and an end past the content is not cut to it). These routes serve ranges on their
// own, so the library's parsed copy is emptied. The request object is the library's own,
// never a constant one, so the cast is sound.
void takeOverRanges(const httplib::Request& request) {
    const_cast<httplib::Request&>(request).ranges.clear();
}

void answerWithItem(httplib::Response& response, ApiContext& context, const Url& url) {
    auto item = context.provider->itemAtURL(url);
    if (!item.ok())
        return ApiReply::error(response, item.error());
    ApiReply::json(response, HostJson::item(*item.value()));
}

Status checkUploadName(const std::string& name) {
    if (name.size() > kMaxUploadNameBytes)
        return ApiReply::badRequest("name must not be longer than 255 bytes");
    return checkItemName(name);
}

// The thumbnail of an image file of the published trees, from the desktop's cache.
void answerWithImageThumbnail(httplib::Response& response, ApiContext& context, const Url& url,
                              int size) {
    auto opened = openRegularFile(url, O_RDONLY);
    if (!opened.ok())
        return ApiReply::error(response, opened.error());
    auto png = context.thumbnails->thumbnail(url.path(), std::move(opened.value().fd), size);
    if (!png.ok()) {
        const Error& error = png.error();
        int status = 0;
        if (error.domain() == kPosixErrorDomain) {
            switch (error.code()) {
                case EFBIG:
                    status = 413;
                    break;
                case EBADMSG:
                    status = 415;
                    break;
                case ETIMEDOUT:
                case ECANCELED:
                    status = 503;
                    break;
            }
        }
        if (status)
            return ApiReply::json(response, HostJson::error(error), status);
        return ApiReply::error(response, error);
    }
    response.set_content(reinterpret_cast<const char*>(png.value().data()), png.value().size(),
                         "image/png");
}

struct Upload {
    std::vector<std::pair<std::string, std::unique_ptr<StagedFile>>> files;
    StagedFile* current = nullptr;
    std::optional<Error> error;  // the first; the rest of the body is read and dropped
};

}  // namespace

void ContentRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext> context) {
    server.Get(kContentPath,
               [context](const httplib::Request& request, httplib::Response& response) {
                   handleDownload(request, response, *context);
               });
    server.Put(kContentPath, [context](const httplib::Request& request, httplib::Response& response,
                                       const httplib::ContentReader& reader) {
        handleSave(request, response, reader, *context);
    });
    server.Get(kThumbnailPath,
               [context](const httplib::Request& request, httplib::Response& response) {
                   handleThumbnail(request, response, *context);
               });
}

void ContentRoutes::addChildrenPost(httplib::Server& server, std::shared_ptr<ApiContext> context,
                                    OtherPost otherwise, size_t jsonLimit) {
    server.Post(
        kChildrenUploadPath, [context, otherwise, jsonLimit](const httplib::Request& request,
                                                             httplib::Response& response,
                                                             const httplib::ContentReader& reader) {
            if (handleUpload(request, response, reader, *context))
                return;
            std::string body;
            bool tooLarge = false;
            bool complete = reader([&](const char* data, size_t length) {
                if (body.size() + length > jsonLimit) {
                    tooLarge = true;
                    return false;
                }
                body.append(data, length);
                return true;
            });
            if (tooLarge) {
                ApiReply::json(
                    response,
                    HostJson::error(ApiReply::badRequest("the request body is too large")), 413);
                response.set_header("Connection", "close");
                return;
            }
            if (!complete)
                return ApiReply::error(response,
                                       ApiReply::badRequest("the request body was cut short"));
            otherwise(request, response, body);
        });
}

bool ContentRoutes::handleUpload(const httplib::Request& request, httplib::Response& response,
                                 const httplib::ContentReader& reader, ApiContext& context) {
    if (!request.is_multipart_form_data())
        return false;
    const std::string identifier = request.matches[1];
    std::optional<Error> refused;
    Url folder;
    if (identifier == HostPorterRootContainerItemIdentifier) {
        // The root holds only the app libraries and the shared area.
        refused = Error::errorFileWriteNoPermission();
    } else if (auto url = contentItemURL(context, identifier); url.ok()) {
        folder = url.value();
    } else {
        refused = url.error();
    }

    Upload upload;
    upload.error = refused;
    bool complete = reader(
        [&](const httplib::MultipartFormData& part) {
            upload.current = nullptr;
            if (upload.error)
                return true;
            if (auto bad = checkUploadName(part.filename); !bad.ok()) {
                upload.error = bad.error();
                return true;
            }
            auto staged = StagedFile::create(folder);
            if (!staged.ok()) {
                upload.error = staged.error();
                return true;
            }
            upload.current = staged.value().get();
            upload.files.emplace_back(part.filename, std::move(staged.value()));
            return true;
        },
        [&](const char* data, size_t length) {
            if (upload.current) {
                if (auto written = upload.current->write(data, length); !written.ok()) {
                    upload.error = written.error();
                    upload.current = nullptr;
                }
            }
            return true;
        });
    // Whatever went wrong, the staging files go with `upload`: nothing half-written stays.
    if (!complete) {
        ApiReply::error(response, ApiReply::badRequest("the upload was cut short"));
        return true;
    }
    if (upload.error) {
        ApiReply::error(response, *upload.error);
        return true;
    }
    if (upload.files.empty()) {
        ApiReply::error(response, ApiReply::badRequest("the upload holds no file"));
        return true;
    }
    nlohmann::json items = nlohmann::json::array();
    for (auto& [name, staged] : upload.files) {
        auto placed = staged->place(name);
        if (!placed.ok()) {
            ApiReply::error(response, placed.error());
            return true;
        }
        auto item = context.provider->itemAtURL(placed.value());
        if (!item.ok()) {
            ApiReply::error(response, item.error());
            return true;
        }
        items.push_back(HostJson::item(*item.value()));
    }
    ApiReply::json(response, {{"items", std::move(items)}});
    return true;
}

void ContentRoutes::handleDownload(const httplib::Request& request, httplib::Response& response,
                                   ApiContext& context) {
    takeOverRanges(request);
    const std::string identifier = request.matches[1];
    auto item = context.provider->itemForIdentifier(identifier);
    if (!item.ok())
        return ApiReply::error(response, item.error());
    if (TypeConforms(item.value()->typeIdentifier(), TypeIdentifiers::kDirectory))
        return ApiReply::error(response, notAFile());
    auto url = contentItemURL(context, identifier);
    if (!url.ok())
        return ApiReply::error(response, url.error());
    auto opened = openRegularFile(url.value(), O_RDONLY);
    if (!opened.ok())
        return ApiReply::error(response, opened.error());
    const uint64_t size = opened.value().size;

    uint64_t first = 0;
    uint64_t length = size;
    auto range = ByteRange::parse(request.get_header_value("Range"), size);
    switch (range.outcome) {
        case ByteRange::Outcome::Whole:
            response.status = 200;
            break;
        case ByteRange::Outcome::Part:
            first = range.first;
            length = range.length;
            response.status = 206;
            response.set_header("Content-Range", "bytes " + std::to_string(first) + "-" +
                                                     std::to_string(first + length - 1) + "/" +
                                                     std::to_string(size));
            break;
        case ByteRange::Outcome::Unsatisfiable:
            response.set_header("Content-Range", "bytes */" + std::to_string(size));
            return ApiReply::json(
                response, HostJson::error(ApiReply::badRequest("the range lies past the end")),
                416);
        case ByteRange::Outcome::Malformed:
            return ApiReply::error(response, ApiReply::badRequest("malformed Range header"));
    }
    const std::string mediaType = ContentTypes::mediaTypeFor(item.value()->typeIdentifier());
    response.set_header("Accept-Ranges", "bytes");
    response.set_header("Content-Disposition",
                        ContentTypes::attachmentDisposition(item.value()->filename()));
    // A document is never run as a page of this origin, whatever it holds (HTML, SVG).
    response.set_header("X-Content-Type-Options", "nosniff");
    response.set_header("Content-Security-Policy", "sandbox");
    if (length == 0) {
        response.set_content("", mediaType);
        return;
    }
    auto fd = std::make_shared<ScopedFd>(std::move(opened.value().fd));
    response.set_content_provider(
        length, mediaType, [fd, first](size_t offset, size_t wanted, httplib::DataSink& sink) {
            std::vector<char> buffer(std::min(wanted, kReadChunk));
            ssize_t n;
            do {
                n = FileSystem::current().pread(fd->get(), buffer.data(), buffer.size(),
                                                static_cast<off_t>(first + offset));
            } while (n < 0 && errno == EINTR);
            // A file cut shorter meanwhile ends the response early: the client sees a short
            // body against the length announced, never made-up bytes.
            if (n <= 0)
                return false;
            return sink.write(buffer.data(), static_cast<size_t>(n));
        });
}

void ContentRoutes::handleSave(const httplib::Request& request, httplib::Response& response,
                               const httplib::ContentReader& reader, ApiContext& context) {
    const std::string identifier = request.matches[1];
    auto url = contentItemURL(context, identifier);
    std::optional<Error> refused;
    std::unique_ptr<StagedFile> staged;
    if (!url.ok()) {
        refused = url.error();
    } else if (auto opened = openRegularFile(url.value(), O_RDONLY); !opened.ok()) {
        refused = opened.error();
    } else if (auto made =
                   StagedFile::create(url.value().deletingLastPathComponent(), opened.value().mode);
               !made.ok()) {
        refused = made.error();
    } else {
        staged = std::move(made.value());
    }
    bool complete = reader([&](const char* data, size_t length) {
        if (!staged)
            return true;  // refused: the body is read and dropped, the connection stays usable
        if (auto written = staged->write(data, length); !written.ok()) {
            refused = written.error();
            staged.reset();
        }
        return true;
    });
    if (!complete)
        return ApiReply::error(response, ApiReply::badRequest("the content was cut short"));
    if (refused)
        return ApiReply::error(response, *refused);
    auto replaced = staged->replace(url.value().lastPathComponent());
    if (!replaced.ok())
        return ApiReply::error(response, replaced.error());
    answerWithItem(response, context, replaced.value());
}

void ContentRoutes::handleThumbnail(const httplib::Request& request, httplib::Response& response,
                                    ApiContext& context) {
    const std::string identifier = request.matches[1];
    int size = kDefaultThumbnail;
    if (request.has_param("size")) {
        const std::string text = request.get_param_value("size");
        auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), size);
        if (error != std::errc() || end != text.data() + text.size() || size < kMinThumbnail ||
            size > kMaxThumbnail)
            return ApiReply::error(response,
                                   ApiReply::badRequest("size must be a number from 16 to 1024"));
    }
    if (context.thumbnails) {
        auto item = context.provider->itemForIdentifier(identifier);
        if (!item.ok())
            return ApiReply::error(response, item.error());
        if (TypeConforms(item.value()->typeIdentifier(), kImageType)) {
            auto url = contentItemURL(context, identifier);
            if (!url.ok())
                return ApiReply::error(response, url.error());
            return answerWithImageThumbnail(response, context, url.value(), size);
        }
    }
    struct Answer {
        std::mutex mutex;
        std::optional<Bytes> png;
        std::optional<Error> error;
        DispatchSemaphore done;
    };
    auto answer = std::make_shared<Answer>();
    HostPorterExtension::PerThumbnailCompletion each = [answer](const HostPorterItemIdentifier&,
                                                                std::optional<Bytes> png,
                                                                std::optional<Error> error) {
        std::lock_guard lock(answer->mutex);
        if (png)
            answer->png = std::move(png);
        if (error)
            answer->error = std::move(error);
    };
    context.provider->fetchThumbnailsForItemIdentifiers({identifier}, {double(size), double(size)},
                                                        each, [answer](Status status) {
                                                            {
                                                                std::lock_guard lock(answer->mutex);
                                                                if (!status.ok() && !answer->error)
                                                                    answer->error = status.error();
                                                            }
                                                            answer->done.signal();
                                                        });
    if (!answer->done.wait(kThumbnailPatience))
        return ApiReply::error(response, Error::posix(ETIMEDOUT));
    std::lock_guard lock(answer->mutex);
    if (answer->png && !answer->png->empty()) {
        response.set_content(reinterpret_cast<const char*>(answer->png->data()),
                             answer->png->size(), "image/png");
        return;
    }
    if (answer->error && ApiReply::httpStatusFor(*answer->error) != 500)
        return ApiReply::error(response, *answer->error);
    ApiReply::error(response, Error(kHostPorterErrorDomain, kHostPorterNoSuchItem,
                                    {{"description", "the item has no thumbnail"}}));
}

}  // namespace tamber
