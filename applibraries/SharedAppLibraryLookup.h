#pragma once

#include <memory>

#include "items/AppLibraryLookup.h"

namespace tamber {

// Answers the identifier code's app-library questions from the shared app-library manager.
class SharedAppLibraryLookup : public AppLibraryLookup {
public:
    // Makes AppLibraryLookup::current() answer from the shared manager (created on first
    // question, not here); returns the lookup it replaces.
    static std::shared_ptr<AppLibraryLookup> install();

    std::vector<Url> rootURLsForAppLibraries() override;
    std::optional<std::string> bundleIdentifierForRoot(const Url& url,
                                                       UrlRelationship relationship) override;
};

}  // namespace tamber
