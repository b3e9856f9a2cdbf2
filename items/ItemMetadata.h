#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Tag.h"
#include "platform/Url.h"
#include "platform/objects/Data.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "platform/objects/String.h"
#include "support/Result.h"

namespace tamber {

// The user metadata kept in an item's extended attributes, decoded. Each value is a keyed
// archive; a missing or undecodable attribute leaves its field empty.
struct ItemMetadata {
    std::shared_ptr<const Date> lastUsedDate;
    // The tag labels as stored, and the same tags (no colour) as platform tag data. When the
    // desktop's tag list ("xdg.tags", see XdgTagList) was changed by another program, reading
    // takes it in first: Tamber's tags are rewritten to match it.
    std::optional<std::vector<std::string>> tagLabels;
    std::optional<Bytes> tagData;
    std::shared_ptr<const Number> favoriteRank;
    std::shared_ptr<const Date> trashDate;
    // The path the item was trashed from, relative to its library.
    std::shared_ptr<const String> putBack;

    // Reads all five attributes (taking in the desktop's tag list when it changed). One attribute
    // listing first, so that an item without metadata (the common case) costs one call instead of
    // five.
    static ItemMetadata read(const Url& url);

    static std::shared_ptr<const Date> readLastUsedDate(const Url& url);
    // Tamber's own tags, each without colour (the desktop list is not consulted).
    static std::optional<std::vector<std::shared_ptr<const Tag>>> readTags(const Url& url);
    static std::optional<std::vector<std::string>> readTagLabels(const Url& url);
    static std::shared_ptr<const Number> readFavoriteRank(const Url& url);
    static std::shared_ptr<const Date> readTrashDate(const Url& url);
    static std::shared_ptr<const String> readPutBack(const Url& url);

    // The one writer of the five attributes: every change to them, from any host or provider
    // operation, goes through these, so that the journal's copy of the document's metadata
    // hears of each write that happened. A null value removes the attribute (removing one
    // that is not there succeeds), except for tags: absent or undecodable tag data is written
    // as an empty list, so that clearing the tags is a change too and the attribute stays. A
    // failure is logged ("can't set xattr NAME on URL; ERROR") and returned. Tags are stored as
    // labels (colours are dropped), and the desktop list "xdg.tags" is written to match (removed
    // when no tag is left); a failure there is logged once and fails nothing (XdgTagList has the
    // rules).
    static Status writeLastUsedDate(const Url& url, const std::shared_ptr<const Date>& date);
    static Status writeTagData(const Url& url, const std::optional<Bytes>& tagData);
    static Status writeFavoriteRank(const Url& url, const std::shared_ptr<const Number>& rank);
    static Status writeTrashDate(const Url& url, const std::shared_ptr<const Date>& date);
    static Status writePutBack(const Url& url, const std::shared_ptr<const String>& path);
    // Sets `name` to bytes already archived, or removes it for nothing; the writers above end
    // here. Opens the item through its read-write access, beneath its published tree.
    static Status writeAttributeData(const Url& url, const std::string& name,
                                     const std::optional<Bytes>& data);

    // Tag data for labels, each a tag without colour.
    static Bytes tagDataForLabels(const std::vector<std::string>& labels);
};

}  // namespace tamber
