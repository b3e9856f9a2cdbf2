#include "cli/ItemMetadataCommand.h"

#include <charconv>

#include "cli/ItemArgument.h"
#include "cli/TagLabels.h"
#include "platform/Tag.h"
#include "platform/objects/Date.h"
#include "platform/objects/Number.h"
#include "runtime/ProviderCalls.h"

namespace tamber {

CLI::App* ItemMetadataCommand::add(CLI::App& app) {
    CLI::App* sub = nullptr;
    switch (verb_) {
        case Verb::Tag:
            sub = app.add_subcommand("tag", "Replace an item's tags (none given: clear them)");
            sub->add_option("ID", item_, "The item: an identifier or a path")->required();
            sub->add_option("TAG", tags_, "The tags, in order");
            break;
        case Verb::Rank:
            sub = app.add_subcommand("rank", "Set or clear an item's favourite rank");
            sub->add_option("ID", item_, "The item: an identifier or a path")->required();
            sub->add_option("RANK", rank_, "An integer, or \"none\" to clear it")->required();
            break;
        case Verb::Touch:
            sub = app.add_subcommand("touch", "Set an item's last-used date to now, or clear it");
            sub->add_option("ID", item_, "The item: an identifier or a path")->required();
            sub->add_flag("--clear", clear_, "Clear the last-used date instead");
            break;
    }
    addJsonFlag(sub, "Print the item as `tamber item --json` does");
    return sub;
}

Status ItemMetadataCommand::checkArguments() {
    if (verb_ != Verb::Rank || rank_ == "none")
        return Status::OK();
    int64_t value = 0;
    auto [end, ec] = std::from_chars(rank_.data(), rank_.data() + rank_.size(), value);
    if (ec != std::errc() || end != rank_.data() + rank_.size())
        return CliContext::usageError("RANK takes an integer or \"none\", not \"" + rank_ + "\"");
    rankValue_ = Number::fromInt64(value);
    return Status::OK();
}

int ItemMetadataCommand::runWith(CliContext& context, HostPorterExtension& provider) {
    auto item = ItemArgument::resolve(provider, item_);
    if (!item.ok())
        return fail(context, item.error());
    return finish(context, ProviderCalls::waitForItem([&](auto done) {
                      switch (verb_) {
                          case Verb::Tag: {
                              std::optional<Bytes> data;
                              if (auto labels = TagLabels::cleaned(tags_); !labels.empty()) {
                                  std::vector<std::shared_ptr<const Tag>> tags;
                                  for (const auto& label : labels) tags.push_back(Tag::make(label));
                                  data = GetTagsDataForTags(tags);
                              }
                              return provider.setTagData(data, item.value(), std::move(done));
                          }
                          case Verb::Rank:
                              return provider.setFavoriteRank(rankValue_, item.value(),
                                                              std::move(done));
                          case Verb::Touch:
                              return provider.setLastUsedDate(clear_ ? nullptr : Date::now(),
                                                              item.value(), std::move(done));
                      }
                  }));
}

}  // namespace tamber
