#pragma once

#include <cstddef>
#include <string>

namespace tamber {

// Secrets for a run (the server's access token): random bytes from the kernel, written as
// lowercase hex.
class RandomToken {
public:
    // `bytes` random bytes as 2 * bytes hex digits. Aborts when the kernel has no randomness to
    // give, rather than hand out a guessable secret.
    static std::string hex(size_t bytes = 32);
    // Whether two secrets are equal, in a time that depends only on their lengths.
    static bool equal(const std::string& a, const std::string& b);
};

}  // namespace tamber
