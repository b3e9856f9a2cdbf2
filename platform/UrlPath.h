#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tamber::UrlPath {

// Lexical path work for file URLs; nothing here touches the file system.

// `path` made absolute against `base` (itself absolute) and standardised: repeated slashes
// collapsed, "." removed, ".." taking away the component before it (at the root it stays at
// the root), no trailing slash except for "/".
std::string standardize(std::string_view path, std::string_view base = "/");

// The working directory, or "/" when it cannot be read (it was removed).
std::string workingDirectory();

// Percent-encodes everything but the characters a URL path may hold as they are (RFC 3986
// unreserved and sub-delimiter characters, ':', '@' and '/').
std::string percentEncode(std::string_view path);
// Decodes "%XX" escapes; nothing when an escape is malformed or decodes to a NUL byte.
std::optional<std::string> percentDecode(std::string_view text);

// Of a standardised path: the last component ("/" for the root), the path without it ("/"
// for the root and its children), and every component with "/" first.
std::string_view lastComponent(std::string_view path);
std::string_view deletingLastComponent(std::string_view path);
std::vector<std::string> components(std::string_view path);

// Whether `name` is a name a directory entry can have, one component: not empty, not "." or
// "..", and without '/' or NUL. Names that come from outside (events, the index, attributes,
// callers) are checked with this before they are joined to a path.
bool isEntryName(std::string_view name);

// The extension of a name, without the dot; empty for "name", ".hidden" and "name.".
std::string_view extension(std::string_view name);

}  // namespace tamber::UrlPath
