#include "platform/UrlPath.h"

#include <unistd.h>

#include <climits>
#include <memory>

namespace tamber::UrlPath {

namespace {

// Appends the standardised components of `path` to `out`, which holds a standardised path
// without its trailing slash ("" for the root).
void appendComponents(std::string& out, std::string_view path) {
    size_t pos = 0;
    while (pos < path.size()) {
        size_t end = path.find('/', pos);
        if (end == std::string_view::npos)
            end = path.size();
        std::string_view component = path.substr(pos, end - pos);
        pos = end + 1;
        if (component.empty() || component == ".")
            continue;
        if (component == "..") {
            out.resize(out.rfind('/') == std::string::npos ? 0 : out.rfind('/'));
            continue;
        }
        out.push_back('/');
        out.append(component);
    }
}

bool keptInPath(unsigned char c) {
    if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9'))
        return true;
    switch (c) {
        case '-':
        case '.':
        case '_':
        case '~':
        case '!':
        case '$':
        case '&':
        case '\'':
        case '(':
        case ')':
        case '*':
        case '+':
        case ',':
        case ';':
        case '=':
        case ':':
        case '@':
        case '/':
            return true;
        default:
            return false;
    }
}

int hexValue(char c) {
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return -1;
}

}  // namespace

std::string standardize(std::string_view path, std::string_view base) {
    std::string out;
    out.reserve(base.size() + path.size() + 1);
    if (!path.starts_with('/'))
        appendComponents(out, base);
    appendComponents(out, path);
    if (out.empty())
        out.push_back('/');
    return out;
}

std::string workingDirectory() {
    // getcwd(NULL, 0) allocates as much as the path needs.
    std::unique_ptr<char, decltype(&::free)> cwd(::getcwd(nullptr, 0), &::free);
    if (!cwd || cwd.get()[0] != '/')
        return "/";
    return cwd.get();
}

std::string percentEncode(std::string_view path) {
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(path.size());
    for (char ch : path) {
        auto c = static_cast<unsigned char>(ch);
        if (keptInPath(c)) {
            out.push_back(ch);
        } else {
            out.push_back('%');
            out.push_back(kHex[c >> 4]);
            out.push_back(kHex[c & 0xF]);
        }
    }
    return out;
}

std::optional<std::string> percentDecode(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (size_t i = 0; i < text.size(); ++i) {
        char c = text[i];
        if (c == '%') {
            if (i + 2 >= text.size())
                return std::nullopt;
            int high = hexValue(text[i + 1]);
            int low = hexValue(text[i + 2]);
            if (high < 0 || low < 0)
                return std::nullopt;
            c = static_cast<char>(high * 16 + low);
            i += 2;
        }
        if (c == '\0')
            return std::nullopt;
        out.push_back(c);
    }
    return out;
}

bool isEntryName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

std::string_view lastComponent(std::string_view path) {
    if (path.empty() || path == "/")
        return path;
    size_t slash = path.rfind('/');
    return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::string_view deletingLastComponent(std::string_view path) {
    size_t slash = path.rfind('/');
    if (slash == std::string_view::npos)
        return {};
    return slash == 0 ? path.substr(0, 1) : path.substr(0, slash);
}

std::vector<std::string> components(std::string_view path) {
    std::vector<std::string> out;
    if (path.empty())
        return out;
    if (path.starts_with('/'))
        out.emplace_back("/");
    size_t pos = 0;
    while (pos < path.size()) {
        size_t end = path.find('/', pos);
        if (end == std::string_view::npos)
            end = path.size();
        if (end > pos)
            out.emplace_back(path.substr(pos, end - pos));
        pos = end + 1;
    }
    return out;
}

std::string_view extension(std::string_view name) {
    size_t dot = name.rfind('.');
    if (dot == std::string_view::npos || dot == 0 || dot + 1 == name.size())
        return {};
    return name.substr(dot + 1);
}

}  // namespace tamber::UrlPath
