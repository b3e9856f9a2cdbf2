#include "cli/ItemArgument.h"

#include <string_view>

#include "host/PublishedTrees.h"

namespace tamber {

namespace {

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

}  // namespace

ItemArgument ItemArgument::parse(const std::string& text) {
    ItemArgument argument;
    if (text == "root") {
        argument.identifier = HostPorterRootContainerItemIdentifier;
    } else if (text == "working-set") {
        argument.identifier = HostPorterWorkingSetContainerItemIdentifier;
    } else if (text == "all-directories") {
        argument.identifier = HostPorterAllDirectoriesContainerItemIdentifier;
    } else if (isHostContainerIdentifier(text) ||
               ((startsWith(text, "fid=") || startsWith(text, "did=") || startsWith(text, "#")) &&
                text.find('/') == std::string::npos)) {
        argument.identifier = text;
    } else {
        argument.kind = Kind::Path;
        argument.url = Url::fileURLWithPath(text);
    }
    return argument;
}

Result<HostPorterItemIdentifier> ItemArgument::resolve(HostPorterExtension& provider,
                                                       const std::string& text) {
    ItemArgument argument = parse(text);
    if (argument.kind == Kind::Identifier)
        return argument.identifier;
    if (auto outside = PublishedTrees::check(argument.url); !outside.ok())
        return outside.error();
    auto identifier = provider.persistentIdentifierForItemAtURL(argument.url);
    if (!identifier)
        return Error::porterErrorForNonExistentItemWithIdentifier(argument.url.path());
    return *identifier;
}

}  // namespace tamber
