#pragma once

#include <cstddef>
#include <cstdint>

#include "support/Result.h"

namespace tamber {

// Checks a binary property list before libplist parses it. libplist 2.2 recurses without a
// depth limit (a few kilobytes of nested arrays overflow the stack) and turns every reference
// into a fresh copy of the referenced object (containers shared at each level expand
// exponentially), so the trailer, the offset table and the object graph are walked here
// first: every reachable object must lie inside the object area, every count must fit in the
// bytes that follow it, there must be no cycle, and the tree libplist would build must stay
// within the limits.
class BinaryPlistValidator {
public:
    struct Limits {
        size_t maxDepth = 64;
        // Nodes libplist would allocate. Without shared containers that is at most one per
        // reference, so an input can justify about one node per byte.
        uint64_t maxNodes = 1u << 24;
        // String and data bytes libplist would copy, shared strings counted once per use.
        uint64_t maxPayloadBytes = 256u << 20;
    };

    // The default limits, with maxNodes scaled to what `size` bytes can justify.
    static Limits limitsForSize(size_t size);

    // An InvalidData error (kArchiveErrorDomain) that says what is wrong, or nothing.
    static Status validate(const uint8_t* data, size_t size, const Limits& limits);
};

}  // namespace tamber
