#pragma once

namespace tamber {

// Ctrl-C and SIGTERM end a verb that follows something live (events, watch) cleanly: the verb
// polls `interrupted()` and tears its stream down instead of dying mid-write.
void catchInterrupts();
bool interrupted();

}  // namespace tamber
