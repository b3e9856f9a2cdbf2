#pragma once

#include <memory>
#include <string>

#include "platform/Url.h"
#include "support/Log.h"

namespace tamber {

// Reads one resource value of `url` as T. A failed read logs at error level and yields
// nothing, as does a value of another class; the caller treats the property as absent.
template <class T>
std::shared_ptr<const T> ResourceValueGetter(const Url& url, ResourceKey key) {
    auto value = url.resourceValue(key);
    if (!value.ok()) {
        logError("can't get resource \"" + std::string(key) + "\" for " + url.absoluteString() +
                 "; " + value.error().description());
        return nullptr;
    }
    return objectCast<T>(value.value());
}

}  // namespace tamber
