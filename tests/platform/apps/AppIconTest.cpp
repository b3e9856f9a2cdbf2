#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <optional>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/apps/AppRecord.h"
#include "platform/imaging/IconTheme.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

using testing::TempDir;

// Sets (or unsets, with nullopt) an environment variable for a scope.
struct ScopedIconEnv {
    ScopedIconEnv(const char* name, std::optional<std::string> value) : name(name) {
        if (const char* old = std::getenv(name))
            previous = old;
        set(value);
    }
    ~ScopedIconEnv() { set(previous); }
    void set(const std::optional<std::string>& v) {
        v ? ::setenv(name, v->c_str(), 1) : ::unsetenv(name);
    }
    const char* name;
    std::optional<std::string> previous;
};

std::shared_ptr<const AppRecord> appWithIcon(std::optional<std::string> icon) {
    return AppRecord::make({"org.example.App", "App", std::nullopt, std::move(icon)}, {});
}

std::string text(const std::optional<Bytes>& bytes) {
    return bytes ? std::string(bytes->begin(), bytes->end()) : "<none>";
}

// A user data folder and two system ones, each with a hicolor theme; every icon file holds
// its own location so that the test sees which one was picked.
class AppIconTest : public ::testing::Test {
protected:
    AppIconTest()
        : home_("XDG_DATA_HOME", dir_ / "user"),
          dirs_("XDG_DATA_DIRS", dir_ / "sys1" + ":relative/ignored:" + dir_ / "sys2/") {}

    void icon(const std::string& where, const std::string& folder, const std::string& name) {
        dir_.writeFile(where + "/icons/hicolor/" + folder + "/apps/" + name, where + ":" + folder);
    }

    TempDir dir_;
    ScopedIconEnv home_;
    ScopedIconEnv dirs_;
};

TEST_F(AppIconTest, PicksTheNearestSizeWithUserIconsFirst) {
    icon("user", "32x32", "app.png");
    icon("user", "48x48", "app.png");
    icon("sys1", "48x48", "app.png");
    icon("sys1", "64x64", "app.png");
    icon("sys2", "128x128", "app.png");
    icon("sys2", "512x512", "other.png");
    auto app = appWithIcon("app");
    EXPECT_EQ(text(app->iconDataForVariant(0)), "user:32x32");
    EXPECT_EQ(text(app->iconDataForVariant(1)), "user:48x48");     // the user's copy wins
    EXPECT_EQ(text(app->iconDataForVariant(15)), "sys1:64x64");    // from a later folder
    EXPECT_EQ(text(app->iconDataForVariant(24)), "sys2:128x128");  // 96: 64 and 128 tie, larger
    EXPECT_EQ(text(app->iconDataForVariant(32)), "sys2:128x128");
    EXPECT_EQ(text(app->iconDataForVariant(7)), "<none>") << "not a variant";
    EXPECT_EQ(text(appWithIcon("app.png")->iconDataForVariant(0)), "user:32x32");
    EXPECT_EQ(text(appWithIcon("other")->iconDataForVariant(0)), "sys2:512x512");
}

TEST_F(AppIconTest, FollowsThemeLinksButSkipsWhatIsNotAnIcon) {
    icon("user", "16x16", "app.png");
    icon("user", "128x1", "app.png");                       // not a size folder
    icon("user", "scalable", "app.png");                    // would need an SVG renderer
    dir_.makeDir("user/icons/hicolor/32x32/apps/app.png");  // a folder by that name
    icon("sys1", "22x22", "real.png");
    ASSERT_EQ(::symlink("real.png", (dir_ / "sys1/icons/hicolor/22x22/apps/app.png").c_str()), 0);
    EXPECT_EQ(text(appWithIcon("app")->iconDataForVariant(32)), "sys1:22x22");
    EXPECT_EQ(text(appWithIcon("app")->iconDataForVariant(0)), "sys1:22x22");
}

TEST_F(AppIconTest, AbsolutePathsAreReadAndBadNamesFindNothing) {
    std::string file = dir_.writeFile("elsewhere/logo.png", "absolute");
    icon("user", "32x32", "x.png");
    EXPECT_EQ(text(appWithIcon(file)->iconDataForVariant(24)), "absolute");
    EXPECT_EQ(text(appWithIcon(file)->iconDataForVariant(99)), "<none>");
    for (std::optional<std::string> name :
         {std::optional<std::string>(), std::optional<std::string>(""),
          std::optional<std::string>("missing"), std::optional<std::string>("32x32/apps/x"),
          std::optional<std::string>("../hicolor/32x32/apps/x"),
          std::optional<std::string>(dir_ / "elsewhere/missing.png")}) {
        EXPECT_EQ(text(appWithIcon(name)->iconDataForVariant(0)), "<none>") << name.value_or("-");
    }
}

TEST_F(AppIconTest, DefaultsToTheHomeFolderAndReportsUnreadableIconsAsNone) {
    icon("home/.local/share", "48x48", "app.png");
    ScopedIconEnv unset("XDG_DATA_HOME", std::nullopt);
    ScopedIconEnv home("HOME", dir_ / "home");
    EXPECT_EQ(IconTheme::hicolorFolders().front(), dir_ / "home/.local/share/icons/hicolor");
    EXPECT_EQ(text(appWithIcon("app")->iconDataForVariant(1)), "home/.local/share:48x48");

    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    fs->inject(FaultInjectingFileSystem::Operation::Open, EACCES, 1, "apps/app.png");
    EXPECT_EQ(text(appWithIcon("app")->iconDataForVariant(1)), "<none>");
    EXPECT_EQ(fs->pendingInjections(), 0u);
    fs->inject(FaultInjectingFileSystem::Operation::ReadDirectory, EIO, -1);
    EXPECT_EQ(text(appWithIcon("app")->iconDataForVariant(1)), "<none>");
}

}  // namespace
}  // namespace tamber
