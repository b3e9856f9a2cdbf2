#pragma once

#include <memory>
#include <optional>
#include <string>

#include "host/HostPorterItem.h"

namespace tamber {

// An item record that is not a file of the published trees: what a host sees through the
// item interface alone.
class FakeItem : public HostPorterItem {
public:
    static std::shared_ptr<const FakeItem> make(std::string identifier, std::string filename,
                                                std::optional<Bytes> tags = std::nullopt) {
        auto item = std::make_shared<FakeItem>();
        item->identifier_ = std::move(identifier);
        item->filename_ = std::move(filename);
        item->tags_ = std::move(tags);
        return item;
    }

    HostPorterItemIdentifier itemIdentifier() const override { return identifier_; }
    HostPorterItemIdentifier parentItemIdentifier() const override { return "fid=1"; }
    std::string filename() const override { return filename_; }
    std::string typeIdentifier() const override { return "public.data"; }
    HostPorterItemCapabilities capabilities() const override { return 0x21; }
    std::optional<Bytes> tagData() const override { return tags_; }
    std::string description() const override { return identifier_; }

private:
    HostPorterItemIdentifier identifier_;
    std::string filename_;
    std::optional<Bytes> tags_;
};

}  // namespace tamber
