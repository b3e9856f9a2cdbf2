#include "cli/MetaCommand.h"

#include <charconv>
#include <ctime>
#include <ostream>

#include "cli/TagLabels.h"
#include "host/PublishedTrees.h"
#include "platform/objects/Number.h"
#include "runtime/JsonValues.h"

namespace tamber {

CLI::App* MetaCommand::add(CLI::App& app) {
    auto* sub = app.add_subcommand("meta",
                                   "Show or change an item's tags, last-used date and "
                                   "favourite rank");
    sub->add_option("PATH", path_, "The file or folder")->required();
    sub->add_flag("--json", json_, "Print JSON");
    sub->add_option("--set-tags", setTags_,
                    "Replace the tags with these comma-separated labels "
                    "(\"\" clears them)");
    sub->add_option("--set-rank", setRank_, "Set the favourite rank to an integer, or \"none\"");
    sub->add_option("--set-last-used", setLastUsed_,
                    "Set the last-used date: \"now\", \"none\" or an ISO 8601 UTC time "
                    "(2026-11-23T05:10:12Z)");
    return sub;
}

namespace {

std::vector<std::string> splitLabels(const std::string& text) {
    std::vector<std::string> labels;
    size_t start = 0;
    while (start <= text.size()) {
        size_t comma = text.find(',', start);
        if (comma == std::string::npos)
            comma = text.size();
        std::string label = text.substr(start, comma - start);
        if (!label.empty())
            labels.push_back(label);
        start = comma + 1;
    }
    return labels;
}

// "2026-11-23T05:10:12Z" or with fractional seconds; UTC only.
std::optional<double> parseIso8601(const std::string& text) {
    std::tm tm{};
    const char* end = strptime(text.c_str(), "%Y-%m-%dT%H:%M:%S", &tm);
    if (!end)
        return std::nullopt;
    double fraction = 0;
    if (*end == '.') {
        const char* digits = ++end;
        double scale = 0.1;
        while (*end >= '0' && *end <= '9') {
            fraction += (*end - '0') * scale;
            scale /= 10;
            ++end;
        }
        if (end == digits)
            return std::nullopt;
    }
    if (std::string_view(end) != "Z")
        return std::nullopt;
    return static_cast<double>(timegm(&tm)) + fraction;
}

}  // namespace

nlohmann::json MetaCommand::toJson(const ItemMetadata& m) {
    nlohmann::json tags = nlohmann::json::array();
    if (m.tagLabels)
        for (const auto& label : *m.tagLabels) tags.push_back(label);
    return {{"lastUsedDate", dateJson(m.lastUsedDate)},
            {"tags", tags},
            {"favoriteRank", numberJson(m.favoriteRank)},
            {"trashDate", dateJson(m.trashDate)},
            {"putBack", m.putBack ? nlohmann::json(m.putBack->value()) : nlohmann::json(nullptr)}};
}

Result<LocalPorter::MetadataChanges> MetaCommand::parseChanges() const {
    LocalPorter::MetadataChanges changes;
    if (setRank_) {
        std::shared_ptr<const Number> rank;
        if (*setRank_ != "none") {
            int64_t value = 0;
            const std::string& s = *setRank_;
            auto [ptr, ec] = std::from_chars(s.data(), s.data() + s.size(), value);
            if (ec != std::errc() || ptr != s.data() + s.size())
                return CliContext::usageError("--set-rank takes an integer or \"none\", not \"" +
                                              s + "\"");
            rank = Number::fromInt64(value);
        }
        changes.favoriteRank = rank;
    }
    if (setLastUsed_) {
        std::shared_ptr<const Date> date;
        if (*setLastUsed_ == "now") {
            date = Date::now();
        } else if (*setLastUsed_ != "none") {
            auto seconds = parseIso8601(*setLastUsed_);
            if (!seconds)
                return CliContext::usageError(
                    "--set-last-used takes \"now\", \"none\" or an ISO 8601 UTC time, not \"" +
                    *setLastUsed_ + "\"");
            date = Date::make(*seconds);
        }
        changes.lastUsedDate = date;
    }
    if (setTags_)
        changes.tagData =
            ItemMetadata::tagDataForLabels(TagLabels::cleaned(splitLabels(*setTags_)));
    return changes;
}

int MetaCommand::run(CliContext& context) {
    Url url = Url::fileURLWithPath(path_);
    // The app libraries are published trees too, even when the provider is not started: take
    // the libraries last found (the main cache) without asking the registry again.
    if (auto stopped = context.publishFromCache(); !stopped.ok())
        return context.fail(stopped.error(), json_);
    if (auto outside = PublishedTrees::check(url); !outside.ok())
        return context.fail(outside.error(), json_);
    auto exists = url.resourceValue(ResourceKeys::kFileID);
    if (!exists.ok()) {
        const Error& e = exists.error();
        return context.fail(
            Error(e.domain(), e.code(), {{"description", "no such file or folder: " + url.path()}}),
            json_);
    }
    // A document saved while nothing watched gets its metadata back when the journal starts;
    // without one (held by another process, say) the attributes are still read and written.
    // A running server's journal is live and sees the change itself.
    if (!context.server())
        context.prepareJournal();
    // Every value is checked before the first write, so that a bad one changes nothing.
    auto changes = parseChanges();
    if (!changes.ok())
        return context.fail(changes.error(), json_);
    if (auto error = LocalPorter::changeMetadataAtURL(url, changes.value()); !error.ok())
        return context.fail(error.error(), json_);

    ItemMetadata metadata = LocalPorter::metadataAtURL(url);
    nlohmann::json j = toJson(metadata);
    if (json_) {
        setTextWithBytes(j, "path", "pathBytes", url.path());
        context.out() << jsonText(j) << "\n";
        return 0;
    }
    auto text = [](const nlohmann::json& v) {
        return v.is_null() ? std::string("-") : v.is_string() ? v.get<std::string>() : jsonText(v);
    };
    std::string tags;
    for (const auto& t : j["tags"]) tags += (tags.empty() ? "" : ", ") + t.get<std::string>();
    context.out() << "path:          " << url.path() << "\n"
                  << "lastUsedDate:  " << text(j["lastUsedDate"]) << "\n"
                  << "tags:          " << (tags.empty() ? "-" : tags) << "\n"
                  << "favoriteRank:  " << text(j["favoriteRank"]) << "\n"
                  << "trashDate:     " << text(j["trashDate"]) << "\n"
                  << "putBack:       " << text(j["putBack"]) << "\n";
    return 0;
}

}  // namespace tamber
