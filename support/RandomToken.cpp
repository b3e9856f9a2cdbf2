#include "support/RandomToken.h"

#include <sys/random.h>

#include <cerrno>
#include <vector>

#include "support/Log.h"

namespace tamber {

std::string RandomToken::hex(size_t bytes) {
    std::vector<unsigned char> raw(bytes);
    size_t filled = 0;
    while (filled < bytes) {
        ssize_t got = ::getrandom(raw.data() + filled, bytes - filled, 0);
        if (got < 0) {
            if (errno == EINTR)
                continue;
            fatalError("no random bytes for a token");
        }
        filled += static_cast<size_t>(got);
    }
    static constexpr char kDigits[] = "0123456789abcdef";
    std::string text;
    text.reserve(bytes * 2);
    for (unsigned char byte : raw) {
        text.push_back(kDigits[byte >> 4]);
        text.push_back(kDigits[byte & 0xf]);
    }
    return text;
}

bool RandomToken::equal(const std::string& a, const std::string& b) {
    // Every byte of the longer one is looked at, whatever matched before.
    size_t length = a.size() > b.size() ? a.size() : b.size();
    unsigned char difference = a.size() == b.size() ? 0 : 1;
    for (size_t i = 0; i < length; ++i) {
        unsigned char x = i < a.size() ? static_cast<unsigned char>(a[i]) : 0;
        unsigned char y = i < b.size() ? static_cast<unsigned char>(b[i]) : 0;
        difference |= static_cast<unsigned char>(x ^ y);
    }
    return difference == 0;
}

}  // namespace tamber
