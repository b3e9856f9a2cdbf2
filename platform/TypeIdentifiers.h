#pragma once

#include <string>
#include <string_view>

namespace tamber {

namespace TypeIdentifiers {
inline constexpr std::string_view kItem = "public.item";
inline constexpr std::string_view kDirectory = "public.directory";
inline constexpr std::string_view kFolder = "public.folder";
inline constexpr std::string_view kPackage = "public.package";
inline constexpr std::string_view kData = "public.data";
inline constexpr std::string_view kSymbolicLink = "public.symlink";
}  // namespace TypeIdentifiers

// Whether `type` is `conformsTo` or below it in the conformance graph. Unknown types conform
// only to themselves and "public.item".
bool TypeConforms(std::string_view type, std::string_view conformsTo);

// The type of a name (by its extension, case-insensitively). A directory with a registered
// package extension is its package type; any other directory is "public.folder". Unknown
// files are "public.data".
std::string TypeIdentifierForName(std::string_view name, bool isDirectory);

// Whether a directory of this name is a package.
bool IsPackageName(std::string_view name);

}  // namespace tamber
