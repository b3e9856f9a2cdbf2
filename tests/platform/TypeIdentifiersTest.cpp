#include "platform/TypeIdentifiers.h"

#include <gtest/gtest.h>

namespace tamber {
namespace {

TEST(TypeIdentifiersTest, ConformanceFollowsTheGraphTransitively) {
    const std::pair<const char*, const char*> conforming[] = {
        {"public.png", "public.image"},
        {"public.png", "public.data"},
        {"public.png", "public.content"},
        {"public.png", "public.item"},
        {"public.utf8-plain-text", "public.text"},
        {"public.source-code", "public.data"},
        {"public.json", "public.content"},
        {"org.gnu.gnu-zip-archive", "public.archive"},
        {"public.mpeg-4-audio", "public.audio"},
        {"public.mpeg-4", "public.content"},
        {"public.folder", "public.directory"},
        {"com.velk.lumen.presentation", "public.package"},
        {"com.velk.lumen.presentation", "public.directory"},
        {"com.velk.resona.song", "public.content"},
        {"com.velk.bundle", "public.item"},
        {"public.symlink", "public.item"},
        {"vendor.unknown", "vendor.unknown"},
        {"vendor.unknown", "public.item"},
    };
    for (const auto& [type, parent] : conforming) {
        EXPECT_TRUE(TypeConforms(type, parent)) << type << " -> " << parent;
    }

    const std::pair<const char*, const char*> notConforming[] = {
        {"public.folder", "public.data"},
        {"public.folder", "public.package"},
        {"com.velk.lumen.presentation", "public.folder"},
        {"com.velk.lumen.presentation", "public.data"},
        {"com.velk.bundle", "public.content"},
        {"public.image", "public.png"},
        {"public.data", "public.content"},
        {"public.archive", "public.content"},
        {"public.symlink", "public.data"},
        {"public.pdf", "public.text"},
        {"public.item", "public.data"},
        {"vendor.unknown", "public.data"},
        {"public.png", "vendor.unknown"},
        {"public.text", "public.plain-text"},
    };
    for (const auto& [type, parent] : notConforming) {
        EXPECT_FALSE(TypeConforms(type, parent)) << type << " -> " << parent;
    }
}

TEST(TypeIdentifiersTest, NamesMapToTypes) {
    EXPECT_EQ(TypeIdentifierForName("photo.PNG", false), "public.png");
    EXPECT_EQ(TypeIdentifierForName("photo.JpEg", false), "public.jpeg");
    EXPECT_EQ(TypeIdentifierForName("notes.txt", false), "public.plain-text");
    EXPECT_EQ(TypeIdentifierForName("backup.tar.gz", false), "org.gnu.gnu-zip-archive");
    EXPECT_EQ(TypeIdentifierForName("README", false), "public.data");
    EXPECT_EQ(TypeIdentifierForName(".png", false), "public.data");
    EXPECT_EQ(TypeIdentifierForName("file.unknownext", false), "public.data");
    EXPECT_EQ(TypeIdentifierForName("a.verylongextensionthatnobodyregistered", false),
              "public.data");

    EXPECT_EQ(TypeIdentifierForName("Keynote.lumen", true), "com.velk.lumen.presentation");
    EXPECT_EQ(TypeIdentifierForName("Track.RESONA", true), "com.velk.resona.song");
    EXPECT_EQ(TypeIdentifierForName("Plugin.bundle", true), "com.velk.bundle");
    EXPECT_EQ(TypeIdentifierForName("Photos.png", true), "public.folder");
    EXPECT_EQ(TypeIdentifierForName("Documents", true), "public.folder");
    // A file is never a package, whatever its name says.
    EXPECT_EQ(TypeIdentifierForName("Keynote.lumen", false), "public.data");

    EXPECT_TRUE(IsPackageName("Deck.Lumen"));
    EXPECT_TRUE(IsPackageName("x.bundle"));
    EXPECT_FALSE(IsPackageName("x.lumen.zip"));
    EXPECT_FALSE(IsPackageName(".lumen"));
    EXPECT_FALSE(IsPackageName("lumen"));
    EXPECT_FALSE(IsPackageName("x.png"));

    // What a name maps to conforms to what the constants promise.
    EXPECT_TRUE(TypeConforms(TypeIdentifierForName("a.lumen", true), TypeIdentifiers::kPackage));
    EXPECT_FALSE(TypeConforms(TypeIdentifierForName("a.lumen", true), TypeIdentifiers::kFolder));
    EXPECT_TRUE(TypeConforms(TypeIdentifierForName("a.heic", false), TypeIdentifiers::kData));
}

}  // namespace
}  // namespace tamber
