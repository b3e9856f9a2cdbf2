#include "cli/TextEscape.h"

#include "runtime/JsonValues.h"

namespace tamber {

namespace {

void appendOctal(std::string& out, unsigned char byte) {
    out += '\\';
    out += static_cast<char>('0' + (byte >> 6));
    out += static_cast<char>('0' + ((byte >> 3) & 7));
    out += static_cast<char>('0' + (byte & 7));
}

// U+0080 to U+009F, encoded C2 80 to C2 9F: control characters too.
bool isC1Control(std::string_view sequence) {
    return sequence.size() == 2 && static_cast<unsigned char>(sequence[0]) == 0xC2 &&
           static_cast<unsigned char>(sequence[1]) <= 0x9F;
}

// The length of the one well-formed UTF-8 sequence that `text` starts with, or 0.
size_t leadingSequence(std::string_view text) {
    const auto lead = static_cast<unsigned char>(text[0]);
    size_t length = lead < 0x80 ? 1 : lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
    if (length > text.size() || !isValidUtf8(text.substr(0, length)))
        return 0;
    return length;
}

}  // namespace

std::string escapedText(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (size_t at = 0; at < text.size();) {
        const auto byte = static_cast<unsigned char>(text[at]);
        if (byte == '\n') {
            out += "\\n";
        } else if (byte == '\t') {
            out += "\\t";
        } else if (byte == '\\') {
            out += "\\\\";
        } else if (byte < 0x20 || byte == 0x7F) {
            appendOctal(out, byte);
        } else if (byte < 0x80) {
            out += static_cast<char>(byte);
        } else if (size_t length = leadingSequence(text.substr(at)); length != 0) {
            std::string_view sequence = text.substr(at, length);
            if (isC1Control(sequence)) {
                for (char c : sequence) appendOctal(out, static_cast<unsigned char>(c));
            } else {
                out += sequence;
            }
            at += length;
            continue;
        } else {
            appendOctal(out, byte);
        }
        ++at;
    }
    return out;
}

}  // namespace tamber
