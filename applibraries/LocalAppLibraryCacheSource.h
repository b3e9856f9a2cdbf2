#pragma once

#include <string_view>

namespace tamber {

// Which of the two app-library caches: what the last refresh found (main), or what the
// working-set root enumerator last reported to the host (workingSet).
enum class LocalAppLibraryCacheSource : int { main = 0, workingSet = 1 };

// "main cache" / "working-set cache": the form used in logs and descriptions.
std::string_view toString(LocalAppLibraryCacheSource source);
// "main" / "working-set": the form used in queue labels.
std::string_view shortLabel(LocalAppLibraryCacheSource source);

}  // namespace tamber
