#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "host/HostPorterItemIdentifier.h"
#include "platform/objects/Data.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"

namespace tamber {

// What an item allows. Folders read "reading" as content enumerating and "writing" as adding
// sub-items.
using HostPorterItemCapabilities = uint64_t;
namespace HostPorterItemCapability {
inline constexpr HostPorterItemCapabilities kReading = 0x1;
inline constexpr HostPorterItemCapabilities kContentEnumerating = 0x1;
inline constexpr HostPorterItemCapabilities kWriting = 0x2;
inline constexpr HostPorterItemCapabilities kAddingSubItems = 0x2;
inline constexpr HostPorterItemCapabilities kReparenting = 0x4;
inline constexpr HostPorterItemCapabilities kRenaming = 0x8;
inline constexpr HostPorterItemCapabilities kTrashing = 0x10;
inline constexpr HostPorterItemCapabilities kDeleting = 0x20;
inline constexpr HostPorterItemCapabilities kAll = 0x3F;
}  // namespace HostPorterItemCapability

// The record the host shows for one item: a snapshot, never updated in place.
class HostPorterItem {
public:
    virtual ~HostPorterItem() = default;

    virtual HostPorterItemIdentifier itemIdentifier() const = 0;
    virtual HostPorterItemIdentifier parentItemIdentifier() const = 0;
    virtual std::string filename() const = 0;
    virtual std::string typeIdentifier() const = 0;
    virtual HostPorterItemCapabilities capabilities() const = 0;

    virtual std::shared_ptr<const Number> documentSize() const { return nullptr; }
    virtual std::shared_ptr<const Number> childItemCount() const { return nullptr; }
    virtual std::shared_ptr<const Date> creationDate() const { return nullptr; }
    virtual std::shared_ptr<const Date> contentModificationDate() const { return nullptr; }
    virtual std::shared_ptr<const Date> lastUsedDate() const { return nullptr; }
    virtual std::optional<Bytes> tagData() const { return std::nullopt; }
    virtual std::shared_ptr<const Number> favoriteRank() const { return nullptr; }
    virtual bool isTrashed() const { return false; }
    virtual std::optional<Bytes> versionIdentifier() const { return std::nullopt; }
    virtual std::string description() const = 0;
};

using HostPorterItemRef = std::shared_ptr<const HostPorterItem>;

}  // namespace tamber
