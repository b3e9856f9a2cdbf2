#include "platform/archive/ArchiveClassRegistry.h"

#include <map>
#include <mutex>
#include <shared_mutex>

#include "platform/archive/BuiltinArchiveClasses.h"
#include "platform/objects/Data.h"
#include "platform/objects/String.h"
#include "support/Log.h"

namespace tamber {

struct ArchiveClassRegistry::State {
    // Guards classes: registration writes, look-ups share it.
    mutable std::shared_mutex mutex;
    std::map<std::string, ArchiveClass, std::less<>> classes;
};

ArchiveClassRegistry& ArchiveClassRegistry::shared() {
    static ArchiveClassRegistry registry;
    return registry;
}

ArchiveClassRegistry::ArchiveClassRegistry() : state_(std::make_shared<State>()) {
    for (auto& archiveClass : builtinArchiveClasses()) add(std::move(archiveClass));
}

void ArchiveClassRegistry::add(ArchiveClass archiveClass) {
    const std::string& name = archiveClass.name;
    if (name.empty() || !archiveClass.encode || !archiveClass.decode ||
        name == String::kClassName || name == Data::kClassName) {
        logError("Ignoring archive class registration for \"" + name + "\"");
        return;
    }
    // Most derived first and "Object" last, whatever the caller gave.
    auto& hierarchy = archiveClass.hierarchy;
    if (hierarchy.empty() || hierarchy.front() != name)
        hierarchy.insert(hierarchy.begin(), name);
    if (hierarchy.back() != "Object")
        hierarchy.push_back("Object");

    std::string key = name;
    std::unique_lock lock(state_->mutex);
    state_->classes.insert_or_assign(std::move(key), std::move(archiveClass));
}

std::optional<ArchiveClass> ArchiveClassRegistry::find(std::string_view name) const {
    std::shared_lock lock(state_->mutex);
    auto it = state_->classes.find(name);
    if (it == state_->classes.end())
        return std::nullopt;
    return it->second;
}

}  // namespace tamber
