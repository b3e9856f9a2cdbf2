#pragma once

#include <filesystem>

namespace tamber::testing {

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
