#include "fs/DocIDPath.h"

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "platform/tremors/TremorFlags.h"

namespace tamber {

namespace {

// The root's name without its leading slash, followed by the slash that ends it.
std::string rootNameWithSlash() {
    return std::string(kTremorDocumentIdRoot + 1) + "/";
}

bool readNumber(const char*& cursor, uint64_t& value) {
    // strtoull would take "-1" for the largest number: another inode altogether.
    const char* first = cursor;
    while (std::isspace(static_cast<unsigned char>(*first))) ++first;
    if (*first == '-')
        return false;
    errno = 0;
    char* end = nullptr;
    unsigned long long number = std::strtoull(cursor, &end, 10);
    if (errno != 0)
        return false;
    value = number;
    cursor = end;
    return true;
}

bool readLiteral(const char*& cursor, const char* end, const char* literal) {
    size_t length = std::strlen(literal);
    if (static_cast<size_t>(end - cursor) < length || std::memcmp(cursor, literal, length) != 0)
        return false;
    cursor += length;
    return true;
}

}  // namespace

std::optional<DocIDPath> DocIDPath::parse(const std::string& path) {
    // c_str() ends in a NUL, so strtoll never reads past the text; `end` catches embedded NULs.
    const char* cursor = path.c_str();
    const char* end = cursor + path.size();
    while (cursor < end && *cursor == '/') ++cursor;
    if (!readLiteral(cursor, end, rootNameWithSlash().c_str()))
        return std::nullopt;
    if (cursor < end && std::isdigit(static_cast<unsigned char>(*cursor))) {
        uint64_t device = 0;  // not used: the stream already chose the device
        if (!readNumber(cursor, device) || !readLiteral(cursor, end, "/"))
            return std::nullopt;
    }
    DocIDPath parsed;
    if (!readLiteral(cursor, end, "changed/") || !readNumber(cursor, parsed.documentID) ||
        !readLiteral(cursor, end, "/src=") || !readNumber(cursor, parsed.source) ||
        !readLiteral(cursor, end, ",dst=") || !readNumber(cursor, parsed.destination))
        return std::nullopt;
    if (cursor != end)
        return std::nullopt;
    return parsed;
}

bool DocIDPath::mentionsDocumentIds(const std::string& path) {
    return path.find(rootNameWithSlash()) != std::string::npos;
}

}  // namespace tamber
