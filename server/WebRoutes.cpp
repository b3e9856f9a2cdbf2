#include "server/WebRoutes.h"

#include <unistd.h>

#include <cerrno>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "server/EmbeddedWeb.h"

namespace tamber {

namespace {

// No page file comes near this; a bigger one in a web root is refused rather than read.
constexpr size_t kMaxFileBytes = 8 * 1024 * 1024;
constexpr const char* kStaticPlaceholder = "{{static}}";

void setCommonHeaders(httplib::Response& response) {
    response.set_header("Content-Security-Policy", WebRoutes::kContentSecurityPolicy);
    response.set_header("X-Content-Type-Options", "nosniff");
    response.set_header("Referrer-Policy", "no-referrer");
    response.set_header("X-Frame-Options", "DENY");
}

void notFound(httplib::Response& response) {
    // The server's error handler writes the error object.
    response.status = 404;
}

bool endsWith(std::string_view text, std::string_view suffix) {
    return text.size() >= suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

}  // namespace

void WebRoutes::add(httplib::Server& server, std::shared_ptr<ApiContext>, std::string webRoot) {
    auto routes = std::shared_ptr<WebRoutes>(new WebRoutes(std::move(webRoot)));
    server.Get("/", [routes](const httplib::Request&, httplib::Response& response) {
        routes->serveIndex(response);
    });
    server.Get(R"(/static/([0-9a-z]+)/(.+))",
               [routes](const httplib::Request& request, httplib::Response& response) {
                   routes->serveAsset(request.matches[1], request.matches[2], response);
               });
}

std::string WebRoutes::contentTypeFor(std::string_view path) {
    struct Type {
        const char* extension;
        const char* mediaType;
    };
    static constexpr Type kTypes[] = {
        {".html", "text/html; charset=utf-8"},
        {".js", "text/javascript; charset=utf-8"},
        {".mjs", "text/javascript; charset=utf-8"},
        {".css", "text/css; charset=utf-8"},
        {".svg", "image/svg+xml"},
        {".png", "image/png"},
        {".ico", "image/x-icon"},
        {".json", "application/json"},
        {".webmanifest", "application/manifest+json"},
        {".woff2", "font/woff2"},
        {".txt", "text/plain; charset=utf-8"},
    };
    for (const auto& type : kTypes)
        if (endsWith(path, type.extension))
            return type.mediaType;
    return "application/octet-stream";
}

bool WebRoutes::servablePath(std::string_view path) {
    if (path.empty() || path.find('\0') != std::string_view::npos ||
        path.find('\\') != std::string_view::npos)
        return false;
    size_t start = 0;
    while (true) {
        size_t end = path.find('/', start);
        std::string_view component = path.substr(
            start, end == std::string_view::npos ? std::string_view::npos : end - start);
        // Also refuses "." and "..", and the hidden files the build leaves out.
        if (component.empty() || component.front() == '.')
            return false;
        if (end == std::string_view::npos)
            return true;
        start = end + 1;
    }
}

std::string WebRoutes::version() const {
    return webRoot_.empty() ? EmbeddedWeb::treeHash() : "dev";
}

std::optional<WebRoutes::File> WebRoutes::load(const std::string& path) const {
    if (!servablePath(path))
        return std::nullopt;
    if (!webRoot_.empty())
        return loadFromDisk(path);
    for (const auto& file : EmbeddedWeb::files()) {
        if (path == file.path)
            return File{std::string(reinterpret_cast<const char*>(file.data), file.size),
                        file.hash};
    }
    return std::nullopt;
}

std::optional<WebRoutes::File> WebRoutes::loadFromDisk(const std::string& path) const {
    FileSystem& fs = FileSystem::current();
    ScopedFd root(fs.open(webRoot_, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!root.ok())
        return std::nullopt;
    ScopedFd fd(fs.openBeneath(root.get(), path, O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!fd.ok())
        return std::nullopt;
    struct statx info {};
    if (fs.statx(fd.get(), "", AT_EMPTY_PATH, STATX_TYPE | STATX_SIZE, &info) != 0 ||
        !S_ISREG(info.stx_mode) || info.stx_size > kMaxFileBytes)
        return std::nullopt;
    File file;
    char buffer[64 * 1024];
    while (true) {
        ssize_t got = fs.read(fd.get(), buffer, sizeof buffer);
        if (got < 0 && errno == EINTR)
            continue;
        if (got < 0)
            return std::nullopt;
        if (got == 0)
            break;
        file.bytes.append(buffer, static_cast<size_t>(got));
        if (file.bytes.size() > kMaxFileBytes)
            return std::nullopt;
    }
    file.hash = "dev";
    return file;
}

void WebRoutes::serveIndex(httplib::Response& response) const {
    auto index = load("index.html");
    if (!index)
        return notFound(response);
    const std::string base = "/static/" + version();
    std::string& html = index->bytes;
    for (size_t at = html.find(kStaticPlaceholder); at != std::string::npos;
         at = html.find(kStaticPlaceholder, at + base.size()))
        html.replace(at, std::char_traits<char>::length(kStaticPlaceholder), base);
    setCommonHeaders(response);
    response.set_header("Cache-Control", "no-cache");
    response.set_content(html, "text/html; charset=utf-8");
}

void WebRoutes::serveAsset(const std::string& version, const std::string& path,
                           httplib::Response& response) const {
    // An asset of another version is not this binary's: answering it would cache the wrong
    // bytes under that version for ever.
    if (version != this->version())
        return notFound(response);
    auto file = load(path);
    if (!file)
        return notFound(response);
    setCommonHeaders(response);
    if (webRoot_.empty()) {
        response.set_header("Cache-Control", "public, max-age=31536000, immutable");
        response.set_header("ETag", "\"" + file->hash + "\"");
    } else {
        response.set_header("Cache-Control", "no-cache");
    }
    response.set_content(std::move(file->bytes), contentTypeFor(path));
}

}  // namespace tamber
