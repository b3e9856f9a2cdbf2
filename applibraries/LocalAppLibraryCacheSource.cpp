#include "applibraries/LocalAppLibraryCacheSource.h"

namespace tamber {

std::string_view toString(LocalAppLibraryCacheSource source) {
    switch (source) {
        case LocalAppLibraryCacheSource::main:
            return "main cache";
        case LocalAppLibraryCacheSource::workingSet:
            return "working-set cache";
    }
    return "unknown cache";
}

std::string_view shortLabel(LocalAppLibraryCacheSource source) {
    switch (source) {
        case LocalAppLibraryCacheSource::main:
            return "main";
        case LocalAppLibraryCacheSource::workingSet:
            return "working-set";
    }
    return "unknown";
}

}  // namespace tamber
