#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "host/UrlOperations.h"
#include "items/AppLibraryLookup.h"

namespace tamber::testing {

// App libraries given by the test as (root, bundle identifier) pairs, in order.
class FakeAppLibraryLookup : public AppLibraryLookup {
public:
    std::vector<std::pair<Url, std::string>> libraries;

    std::vector<Url> rootURLsForAppLibraries() override {
        std::vector<Url> roots;
        for (auto& entry : libraries) roots.push_back(entry.first);
        return roots;
    }
    std::optional<std::string> bundleIdentifierForRoot(const Url& url,
                                                       UrlRelationship relationship) override {
        for (auto& [root, bundle] : libraries)
            if (pt_relationshipToItemAtURL(root, url) == relationship)
                return bundle;
        return std::nullopt;
    }
};

}  // namespace tamber::testing
