#include "fs/CanonicalUUID.h"

#include <cctype>

namespace tamber {

std::optional<std::string> canonicalUUIDText(std::string_view text) {
    if (text.size() != 36)
        return std::nullopt;
    std::string out(text);
    for (size_t i = 0; i < out.size(); ++i) {
        auto c = static_cast<unsigned char>(out[i]);
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (c != '-')
                return std::nullopt;
        } else if (std::isxdigit(c)) {
            out[i] = static_cast<char>(std::toupper(c));
        } else {
            return std::nullopt;
        }
    }
    return out;
}

}  // namespace tamber
