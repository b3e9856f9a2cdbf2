#pragma once

#include <string>
#include <string_view>

namespace tamber {

// A name as `ls -b` prints it, so that one entry is one line and every byte can be told: "\n",
// "\t" and "\\" for those characters, "\ooo" (octal) for every other control character and for
// each byte that is not part of well-formed UTF-8. Printable characters, spaces included, stay.
std::string escapedText(std::string_view text);

}  // namespace tamber
