#include "cli/ContainerArgument.h"

#include "cli/ItemArgument.h"

namespace tamber {

Result<ContainerArgument> ContainerArgument::resolve(HostPorterExtension& provider,
                                                     const std::string& text) {
    auto identifier = ItemArgument::resolve(provider, text);
    if (!identifier.ok())
        return identifier.error();
    auto enumerator = provider.enumeratorForContainerItemIdentifier(identifier.value());
    if (!enumerator.ok())
        return enumerator.error();
    return ContainerArgument{identifier.value(), enumerator.value()};
}

}  // namespace tamber
