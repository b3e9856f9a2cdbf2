#include "cli/ContainerArgument.h"

#include "cli/ItemArgument.h"

namespace tamber {

Result<ContainerArgument> ContainerArgument::resolve(LocalPorter& porter, const std::string& text) {
    ItemArgument argument = ItemArgument::parse(text);
    ContainerArgument container;
    if (argument.kind == ItemArgument::Kind::Path) {
        auto identifier = porter._persistentIdentifierForItemAt(argument.url);
        if (!identifier)
            return Error::porterErrorForNonExistentItemWithIdentifier(argument.url.path());
        container.identifier = *identifier;
    } else {
        container.identifier = argument.identifier;
    }
    auto enumerator = porter.enumeratorForContainerItemIdentifier(container.identifier);
    if (!enumerator.ok())
        return enumerator.error();
    container.enumerator = enumerator.value();
    return container;
}

}  // namespace tamber
