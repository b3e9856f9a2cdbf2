#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include <httplib.h>

#include "server/ApiContext.h"

namespace tamber {

// The web page: GET / answers web/index.html (never cached, so a new binary's page is seen at
// once), and GET /static/VERSION/PATH answers the file web/PATH, cacheable for ever because
// VERSION is a hash over every file of web/ (so relative imports between modules keep working
// and all change together). Every answer carries a strict Content-Security-Policy (scripts,
// styles, images and connections from this origin only; no inline script) and nosniff.
//
// The files are the ones embedded into the binary, unless a web root is given (`tamber serve
// --web-root DIR`, for working on the page): then they are read from DIR on every request,
// confined to it (no "..", no absolute path, no symbolic link), VERSION is "dev" and nothing
// is cached.
class WebRoutes {
public:
    static constexpr const char* kContentSecurityPolicy =
        "default-src 'self'; script-src 'self'; style-src 'self'; img-src 'self' blob: data:; "
        "connect-src 'self'; font-src 'self'; object-src 'none'; base-uri 'none'; "
        "form-action 'none'; frame-ancestors 'none'";

    // A route group for TamberServer; `webRoot` empty: the embedded files.
    static void add(httplib::Server& server, std::shared_ptr<ApiContext> context,
                    std::string webRoot);

    // The media type the page's files are served with, by the name's extension.
    static std::string contentTypeFor(std::string_view path);
    // Whether `path` (relative to the web root) names a file that may be served: non-empty,
    // "/"-separated components none of which is empty, "." or "..", or starts with a dot, and
    // no NUL or backslash.
    static bool servablePath(std::string_view path);

private:
    struct File {
        std::string bytes;
        std::string hash;
    };

    explicit WebRoutes(std::string webRoot) : webRoot_(std::move(webRoot)) {}

    std::string version() const;
    std::optional<File> load(const std::string& path) const;
    std::optional<File> loadFromDisk(const std::string& path) const;
    void serveIndex(httplib::Response& response) const;
    void serveAsset(const std::string& version, const std::string& path,
                    httplib::Response& response) const;

    const std::string webRoot_;
};

}  // namespace tamber
