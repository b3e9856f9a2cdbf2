#include "cli/ContainerArgument.h"

#include "cli/ItemAction.h"

namespace tamber {

Result<ContainerArgument> ContainerArgument::resolve(LocalPorter& porter, const std::string& text) {
    auto identifier = ItemAction::identifierFor(porter, text);
    if (!identifier.ok())
        return identifier.error();
    auto enumerator = porter.enumeratorForContainerItemIdentifier(identifier.value());
    if (!enumerator.ok())
        return enumerator.error();
    return ContainerArgument{identifier.value(), enumerator.value()};
}

}  // namespace tamber
