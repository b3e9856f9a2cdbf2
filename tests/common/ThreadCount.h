#pragma once

#include <filesystem>

#include "tests/common/Sanitizers.h"

namespace tamber::testing {

// Threads a sanitizer may start of its own accord, once, at a moment of its choosing
// (ThreadSanitizer's background thread): a thread count may grow by this much and no more.
#if defined(TAMBER_TESTS_TSAN)
inline constexpr size_t kSanitizerThreads = 1;
#else
inline constexpr size_t kSanitizerThreads = 0;
#endif

// The threads of this process now, as the kernel lists them: a test's own count, independent
// of what the program believes it started.
inline size_t liveThreadCount() {
    size_t count = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator("/proc/self/task"))
        ++count;
    return count;
}

}  // namespace tamber::testing
