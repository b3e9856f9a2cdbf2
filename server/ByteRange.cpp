#include "server/ByteRange.h"

#include <charconv>
#include <optional>

namespace tamber {

namespace {

std::optional<uint64_t> number(std::string_view text) {
    uint64_t value = 0;
    if (text.empty())
        return std::nullopt;
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (error != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    return value;
}

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) text.remove_prefix(1);
    while (!text.empty() && (text.back() == ' ' || text.back() == '\t')) text.remove_suffix(1);
    return text;
}

}  // namespace

ByteRange ByteRange::parse(std::string_view header, uint64_t size) {
    header = trimmed(header);
    if (header.empty())
        return {};
    constexpr std::string_view kUnit = "bytes=";
    if (!header.starts_with(kUnit))
        return {};  // a unit we do not know: the header is ignored
    std::string_view rangeText = trimmed(header.substr(kUnit.size()));
    if (rangeText.find(',') != std::string_view::npos)
        return {};  // several ranges: served whole rather than as a multipart body
    size_t dash = rangeText.find('-');
    if (dash == std::string_view::npos)
        return {Outcome::Malformed};
    std::string_view from = trimmed(rangeText.substr(0, dash));
    std::string_view to = trimmed(rangeText.substr(dash + 1));
    if (from.empty()) {
        auto suffix = number(to);
        if (!suffix)
            return {Outcome::Malformed};
        if (*suffix == 0 || size == 0)
            return {Outcome::Unsatisfiable};
        uint64_t length = *suffix < size ? *suffix : size;
        return {Outcome::Part, size - length, length};
    }
    auto first = number(from);
    if (!first)
        return {Outcome::Malformed};
    uint64_t last = size == 0 ? 0 : size - 1;
    if (!to.empty()) {
        auto end = number(to);
        if (!end || *end < *first)
            return {Outcome::Malformed};
        if (*end < last)
            last = *end;
    }
    if (*first >= size)
        return {Outcome::Unsatisfiable};
    return {Outcome::Part, *first, last - *first + 1};
}

}  // namespace tamber
