#include "platform/TypeIdentifiers.h"

#include <gtest/gtest.h>

namespace tamber {
namespace {

TEST(TypeIdentifiersTest, ConformanceFollowsTheGraphTransitively) {
    const std::tuple<const char*, const char*, bool> cases[] = {
        {"public.png", "public.content", true},
        {"public.utf8-plain-text", "public.text", true},
        {"org.gnu.gnu-zip-archive", "public.archive", true},
        {"com.velk.lumen.presentation", "public.directory", true},
        {"com.velk.resona.song", "public.content", true},
        {"vendor.unknown", "public.item", true},
        {"public.folder", "public.package", false},
        {"com.velk.lumen.presentation", "public.folder", false},
        {"com.velk.bundle", "public.content", false},
        {"public.image", "public.png", false},
        {"public.archive", "public.content", false},
        {"public.symlink", "public.data", false},
        {"vendor.unknown", "public.data", false},
    };
    for (const auto& [type, parent, conforms] : cases)
        EXPECT_EQ(TypeConforms(type, parent), conforms) << type << " -> " << parent;
}

TEST(TypeIdentifiersTest, NamesMapToTypesAndOnlyFoldersArePackages) {
    const std::tuple<const char*, bool, const char*> cases[] = {
        {"photo.JpEg", false, "public.jpeg"},
        {"backup.tar.gz", false, "org.gnu.gnu-zip-archive"},
        {".png", false, "public.data"},
        {"Keynote.lumen", true, "com.velk.lumen.presentation"},
        {"Track.RESONA", true, "com.velk.resona.song"},
        {"Keynote.lumen", false, "public.data"},
        {"Photos.png", true, "public.folder"},
    };
    for (const auto& [name, isDirectory, type] : cases)
        EXPECT_EQ(TypeIdentifierForName(name, isDirectory), type) << name;
    for (const char* name : {"Deck.Lumen", "x.resona", "x.bundle"})
        EXPECT_TRUE(IsPackageName(name));
    for (const char* name : {"x.lumen.zip", ".lumen", "lumen", "x.png"})
        EXPECT_FALSE(IsPackageName(name)) << name;
}

}  // namespace
}  // namespace tamber
