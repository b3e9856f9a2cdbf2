#pragma once

#include <memory>
#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

#include "platform/objects/Date.h"
#include "platform/objects/Number.h"

namespace tamber {

// How values appear in the command line's JSON: dates as ISO 8601 UTC text, numbers as their
// own kind, absent values as null. A date without a calendar date to write (NaN, infinite,
// outside the years 0000 to 9999) is null too, never text that a parser would choke on.
nlohmann::json dateJson(const std::shared_ptr<const Date>& date);
nlohmann::json numberJson(const std::shared_ptr<const Number>& number);

// File names are bytes, JSON text is UTF-8.
bool isValidUtf8(std::string_view text);
// The text with each ill-formed sequence (the longest start of a sequence that cannot be
// completed, or a lone byte) replaced by U+FFFD.
std::string validUtf8(std::string_view text);
// Sets object[key] to the text made valid, and, only when that changed it, object[bytesKey] to
// the exact bytes in base64, so that a script can still name the file.
void setTextWithBytes(nlohmann::json& object, const std::string& key, const std::string& bytesKey,
                      std::string_view text);
// Compact JSON text. Every verb prints through it: should a string that is not UTF-8 slip into
// a value after all, it shows U+FFFD instead of ending the program with an exception.
std::string jsonText(const nlohmann::json& value);

}  // namespace tamber
