#pragma once

#include <cstdint>
#include <string_view>

namespace tamber {

// One range of a `Range: bytes=...` request header, resolved against the size of the content.
struct ByteRange {
    enum class Outcome {
        Whole,          // no range asked for, or a header this server does not serve in parts
                        // (another unit, several ranges): the whole content, 200
        Part,           // [first, first + length) is satisfiable: 206
        Unsatisfiable,  // every byte asked for lies past the end: 416
        Malformed,      // not a byte-range header: 400
    };
    Outcome outcome = Outcome::Whole;
    uint64_t first = 0;  // the first byte served
    uint64_t length = 0;

    // "bytes=A-B", "bytes=A-" and "bytes=-N" (the last N bytes); B past the end is cut to it.
    static ByteRange parse(std::string_view header, uint64_t size);
};

}  // namespace tamber
