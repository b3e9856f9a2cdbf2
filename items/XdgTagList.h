#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Tag.h"
#include "platform/objects/Data.h"

namespace tamber {

// The comma-separated tag list that desktop file managers and indexers keep in the attribute
// "xdg.tags" ("user.xdg.tags" on disk), and how it is folded into Tamber's own tags.
//
// Rules, so that neither side corrupts the other:
// - Reading splits on commas, trims spaces, tabs and line breaks around each entry, and drops
//   empty entries, duplicates, entries that are not UTF-8 (or hold a NUL or a control character)
//   and entries longer than kMaxLabelBytes; at most kMaxTags entries are taken.
// - Writing lists only the labels that reading gives back unchanged ("representable"). A label
//   with a comma, surrounding spaces or control characters stays Tamber's alone: it is left out
//   of the desktop list and is kept when that list changes.
// - The desktop list holds names only: a name it adds gets no colour (0), and a kept name keeps
//   the tag it had.
class XdgTagList {
public:
    using Tags = std::vector<std::shared_ptr<const Tag>>;

    static constexpr size_t kMaxLabelBytes = 255;
    static constexpr size_t kMaxTags = 256;

    static const std::string& attributeName();  // "xdg.tags"
    // Tamber's note of the desktop list it last wrote or took in: its fingerprint. A list that
    // no longer matches it was changed by another program.
    static const std::string& syncedAttributeName();

    static std::vector<std::string> parse(std::string_view value);
    static bool representable(std::string_view label);
    // The list for `labels`, or nothing (remove the attribute) when none is representable.
    static std::optional<Bytes> format(const std::vector<std::string>& labels);
    static Bytes fingerprint(const Bytes& value);

    // `ours` after the desktop list became `theirs`: its names in its order, each with the colour
    // it has in `ours` (0 when new), then the tags of `ours` that the list cannot hold.
    static Tags merged(const Tags& ours, const std::vector<std::string>& theirs);
};

}  // namespace tamber
