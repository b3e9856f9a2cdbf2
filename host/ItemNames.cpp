#include "host/ItemNames.h"

#include "support/Error.h"

namespace tamber {

namespace {

Error nameError(const std::string& name, const std::string& what) {
    return Error(kHostPorterErrorDomain, kHostPorterInvalidParameter,
                 {{"parameter", "name"}, {"value", name}, {"description", what}});
}

}  // namespace

Status checkItemName(const std::string& name) {
    if (name.empty())
        return nameError(name, "name must not be empty");
    if (name == "." || name == "..")
        return nameError(name, "name '" + name + "' is reserved");
    if (name.find('/') != std::string::npos)
        return nameError(name, "name must not contain '/'");
    if (name.find('\0') != std::string::npos)
        return nameError(name, "name must not contain a NUL byte");
    if (name == kTrashFolderName)
        return nameError(name, "name '" + name + "' is reserved");
    return Status::OK();
}

}  // namespace tamber
