#include "runtime/JsonValues.h"

#include <cmath>
#include <string>

#include "runtime/Base64.h"

namespace tamber {

namespace {

// 0000-01-01T00:00:00Z and 9999-12-31T23:59:59Z: the dates ISO 8601's four-digit years can
// write. An attribute can hold any double (NaN, 1e300); such a date has no text to show.
constexpr double kFirstWritable = -62167219200.0;
constexpr double kLastWritable = 253402300799.0;

}  // namespace

nlohmann::json dateJson(const std::shared_ptr<const Date>& date) {
    if (!date)
        return nullptr;
    double seconds = date->timeIntervalSince1970();
    if (!std::isfinite(seconds) || seconds < kFirstWritable || seconds > kLastWritable)
        return nullptr;
    std::string text = date->iso8601();
    // The formatter has narrower limits of its own on some systems; what it can't write is
    // not a date either.
    if (text.empty() || text.front() < '0' || text.front() > '9')
        return nullptr;
    return text;
}

nlohmann::json numberJson(const std::shared_ptr<const Number>& n) {
    if (!n)
        return nullptr;
    switch (n->kind()) {
        case Number::Kind::Unsigned:
            return n->uint64Value();
        case Number::Kind::Signed:
            return n->int64Value();
        case Number::Kind::Floating:
            return n->doubleValue();
        case Number::Kind::Boolean:
            return n->boolValue();
    }
    return nullptr;
}

namespace {

constexpr std::string_view kReplacement = "\xEF\xBF\xBD";  // U+FFFD

// The length of the well-formed sequence at `at`, or 0 with `bad` set to the length of the
// ill-formed start to replace (at least 1). Overlong forms, surrogates and code points past
// U+10FFFF are ill-formed.
size_t sequenceAt(std::string_view text, size_t at, size_t& bad) {
    const auto lead = static_cast<unsigned char>(text[at]);
    if (lead < 0x80)
        return 1;
    size_t continuations = 0;
    unsigned char low = 0x80, high = 0xBF;  // allowed range of the first continuation byte
    if (lead >= 0xC2 && lead <= 0xDF) {
        continuations = 1;
    } else if (lead == 0xE0) {
        continuations = 2, low = 0xA0;
    } else if (lead == 0xED) {
        continuations = 2, high = 0x9F;
    } else if (lead >= 0xE1 && lead <= 0xEF) {
        continuations = 2;
    } else if (lead == 0xF0) {
        continuations = 3, low = 0x90;
    } else if (lead >= 0xF1 && lead <= 0xF3) {
        continuations = 3;
    } else if (lead == 0xF4) {
        continuations = 3, high = 0x8F;
    } else {
        bad = 1;
        return 0;
    }
    size_t length = 1;
    for (; length <= continuations && at + length < text.size(); ++length) {
        const auto byte = static_cast<unsigned char>(text[at + length]);
        if (byte < (length == 1 ? low : 0x80) || byte > (length == 1 ? high : 0xBF))
            break;
    }
    if (length == continuations + 1)
        return length;
    bad = length;
    return 0;
}

}  // namespace

bool isValidUtf8(std::string_view text) {
    for (size_t at = 0, bad = 0; at < text.size();) {
        size_t length = sequenceAt(text, at, bad);
        if (length == 0)
            return false;
        at += length;
    }
    return true;
}

std::string validUtf8(std::string_view text) {
    std::string valid;
    valid.reserve(text.size());
    for (size_t at = 0, bad = 0; at < text.size();) {
        size_t length = sequenceAt(text, at, bad);
        if (length == 0) {
            valid += kReplacement;
            at += bad;
        } else {
            valid.append(text, at, length);
            at += length;
        }
    }
    return valid;
}

void setTextWithBytes(nlohmann::json& object, const std::string& key, const std::string& bytesKey,
                      std::string_view text) {
    if (isValidUtf8(text)) {
        object[key] = std::string(text);
        return;
    }
    object[key] = validUtf8(text);
    object[bytesKey] = base64Encode(Bytes(text.begin(), text.end()));
}

std::string jsonText(const nlohmann::json& value) {
    return value.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

}  // namespace tamber
