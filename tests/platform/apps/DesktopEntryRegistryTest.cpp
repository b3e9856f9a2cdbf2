#include "platform/apps/DesktopEntryRegistry.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <optional>

#include "platform/FaultInjectingFileSystem.h"
#include "platform/LinuxFileSystem.h"
#include "platform/apps/AppRecord.h"
#include "tests/common/ScopedFileSystem.h"
#include "tests/common/ScopedLogCapture.h"
#include "tests/common/TempDir.h"

namespace tamber {
namespace {

// Sets (or unsets, with nullopt) an environment variable for a scope.
struct ScopedEnv {
    ScopedEnv(const char* name, std::optional<std::string> value) : name(name) {
        if (const char* old = std::getenv(name))
            previous = old;
        set(value);
    }
    ~ScopedEnv() { set(previous); }
    void set(const std::optional<std::string>& v) {
        v ? ::setenv(name, v->c_str(), 1) : ::unsetenv(name);
    }
    const char* name;
    std::optional<std::string> previous;
};

class DesktopEntryRegistryTest : public ::testing::Test {
protected:
    // `where` is "user", "sys1" or "sys2".
    std::string write(const std::string& where, const std::string& relative,
                      const std::string& contents) {
        std::string base = where == "user" ? "home/.local/share" : where;
        return dir_.writeFile(base + "/applications/" + relative, contents);
    }
    std::string app(const std::string& where, const std::string& relative, const std::string& name,
                    const std::string& extra = "") {
        return write(where, relative,
                     "[Desktop Entry]\nType=Application\nName=" + name + "\n" + extra);
    }
    // "id:name" per record, "<null>" for a null one.
    std::vector<std::string> names(int type) {
        std::vector<std::string> out;
        registry_.enumerateApplicationsOfType(type, [&](const BundleRecordRef& r, bool&) {
            out.push_back(r ? *r->bundleIdentifier() + ":" + r->localizedName().value_or("?")
                            : "<null>");
        });
        return out;
    }
    std::optional<std::string> container(const std::string& id) {
        auto record = registry_.recordForBundleIdentifier(id);
        EXPECT_TRUE(record) << id;
        if (!record || !record->dataContainerURL())
            return std::nullopt;
        return record->dataContainerURL()->path();
    }

    testing::TempDir dir_;
    std::string home_ = dir_.makeDir("home");
    ScopedEnv homeEnv_{"HOME", home_};
    ScopedEnv dataHome_{"XDG_DATA_HOME", dir_ / "home/.local/share"};
    ScopedEnv dataDirs_{"XDG_DATA_DIRS", dir_ / "sys1" + ":" + dir_ / "sys2"};
    DesktopEntryRegistry registry_;
};

using V = std::vector<std::string>;

TEST_F(DesktopEntryRegistryTest, EarlierDirectoriesShadowLaterOnesInBothEnumerationAndLookup) {
    app("user", "b.desktop", "User B");
    app("user", "h.desktop", "Hidden", "Hidden=true\n");
    app("sys1", "b.desktop", "System B");
    app("sys1", "c.desktop", "C");
    app("sys1", "a.desktop", "A1");
    app("sys1", "h.desktop", "System H");
    app("sys2", "a.desktop", "A2");
    app("sys2", "d.desktop", "D");
    // Entries in subfolders take hyphenated IDs; the first path in sort order wins.
    app("user", "vendor/tool.desktop", "Nested");
    app("user", "x/y.desktop", "Slash");
    app("user", "x-y.desktop", "Hyphen");
    app("user", "notes.desktop.bak", "Backup");
    app("sys1", "vendor-tool.desktop", "Shadowed");

    const V user = {"b:User B", "vendor-tool:Nested", "x-y:Hyphen"};
    EXPECT_EQ(names(AppRegistry::kUserApplications), user);
    EXPECT_EQ(names(AppRegistry::kSystemApplications), (V{"a:A1", "c:C", "d:D"}));
    EXPECT_EQ(registry_.recordForBundleIdentifier("b")->localizedName(), "User B");
    EXPECT_EQ(registry_.recordForBundleIdentifier("a")->localizedName(), "A1");
    EXPECT_EQ(registry_.recordForBundleIdentifier("vendor-tool")->localizedName(), "Nested");
    EXPECT_FALSE(registry_.recordForBundleIdentifier("h")) << "a hidden entry deletes the ID";

    // The environment is read at every call, not once per process; relative paths in it are
    // ignored (XDG_DATA_HOME then defaults to the same folder under $HOME).
    dataHome_.set(dir_ / "elsewhere");
    EXPECT_TRUE(names(AppRegistry::kUserApplications).empty());
    EXPECT_EQ(registry_.recordForBundleIdentifier("b")->localizedName(), "System B");
    dataHome_.set("relative");
    dataDirs_.set("relative:" + dir_ / "sys2");
    EXPECT_EQ(names(AppRegistry::kUserApplications), user);
    EXPECT_EQ(names(AppRegistry::kSystemApplications), (V{"a:A2", "d:D"}));
}

TEST_F(DesktopEntryRegistryTest, ContainersExpandHomeOrFallBackToFlatpakAndFlagsAreRead) {
    app("user", "tilde.desktop", "T",
        "X-Tamber-Data-Container=~/Containers/tilde\nX-Tamber-Supports-Open-In-Place=true\n"
        "X-Tamber-File-Sharing-Enabled=true\n");
    app("user", "abs.desktop", "A", "X-Tamber-Data-Container=/srv/data/../apps/abs\n");
    app("user", "rel.desktop", "R", "X-Tamber-Data-Container=data/rel\nX-Flatpak=rel\n");
    app("user", "org/flat.desktop", "F", "X-Flatpak=org.flat\n");
    app("user", "none.desktop", "N", "X-Tamber-Supports-Open-In-Place=yes\n");
    write("user", "link.desktop", "[Desktop Entry]\nType=Link\nIcon=web\nURL=x\nX-Flatpak=l\n");

    EXPECT_EQ(container("tilde"), home_ + "/Containers/tilde");
    EXPECT_EQ(container("abs"), "/srv/apps/abs");
    EXPECT_EQ(container("rel"), std::nullopt) << "an explicit bad container is not replaced";
    EXPECT_EQ(container("org-flat"), home_ + "/.var/app/org-flat");
    EXPECT_EQ(container("none"), std::nullopt);
    EXPECT_EQ(container("link"), home_ + "/.var/app/link");
    auto link = registry_.recordForBundleIdentifier("link");
    ASSERT_TRUE(link);
    EXPECT_FALSE(objectCast<AppRecord>(link)) << "only applications are application records";
    EXPECT_EQ(link->iconName(), "web");
    auto flagged = objectCast<AppRecord>(registry_.recordForBundleIdentifier("tilde"));
    auto plain = objectCast<AppRecord>(registry_.recordForBundleIdentifier("none"));
    ASSERT_TRUE(flagged && plain);
    EXPECT_TRUE(flagged->supportsOpenInPlace() && flagged->fileSharingEnabled());
    EXPECT_FALSE(plain->supportsOpenInPlace()) << "\"yes\" is not a desktop-entry boolean";

    homeEnv_.set(std::nullopt);
    EXPECT_EQ(container("tilde"), std::nullopt);
    EXPECT_EQ(container("org-flat"), std::nullopt);
}

TEST_F(DesktopEntryRegistryTest, BrokenEntriesGiveNullRecordsAndTheRestStillComes) {
    testing::ScopedLogCapture log;
    write("user", "a-binary.desktop", std::string("\x7f\x45LF\0\0\x01\xff\xfe garbage\n\x00[", 20));
    write("user", "b-notype.desktop", "[Desktop Entry]\nName=No type\n");
    write("user", "c-group.desktop", "[Other]\nA=1\n[Desktop Entry]\nType=Application\n");
    app("user", "d-noprog.desktop", "Gone", "Exec=tamber-no-such-program --x\n");
    app("user", "e-tryexec.desktop", "Uninstalled", "TryExec=tamber-no-such-program\n");
    write("user", "f-empty.desktop", "");
    app("user", "g-good.desktop", "Good", "Exec=sh -c true\n");

    EXPECT_EQ(names(AppRegistry::kUserApplications),
              (V{"<null>", "<null>", "<null>", "<null>", "<null>", "g-good:Good"}));
    EXPECT_FALSE(registry_.recordForBundleIdentifier("a-binary"));
    EXPECT_GE(log->countStartingWith("[DEBUG] can't load desktop entry " + dir_.path()), 5u);

    int calls = 0;
    registry_.enumerateApplicationsOfType(
        AppRegistry::kUserApplications,
        [&](const BundleRecordRef&, bool& stop) { stop = ++calls == 2; });
    EXPECT_EQ(calls, 2);
}

TEST_F(DesktopEntryRegistryTest, ReadFailuresAreContainedToTheirEntryOrFolder) {
    using Op = FaultInjectingFileSystem::Operation;
    auto fs = std::make_shared<FaultInjectingFileSystem>(std::make_shared<LinuxFileSystem>());
    testing::ScopedFileSystem scoped(fs);
    testing::ScopedLogCapture log;
    app("user", "a.desktop", "A");
    app("user", "b.desktop", "B");
    app("user", "locked/c.desktop", "C");
    fs->inject(Op::Read, EIO, -1, "/a.desktop");
    fs->inject(Op::Open, EACCES, -1, "/locked");

    EXPECT_EQ(names(AppRegistry::kUserApplications), (V{"<null>", "b:B"}));
    std::string apps = dir_.path() + "/home/.local/share/applications/";
    EXPECT_EQ(
        log->texts(),
        (V{"[DEBUG] can't read applications directory " + apps + "locked; " + std::strerror(EACCES),
           "[DEBUG] can't load desktop entry " + apps + "a.desktop; " + std::strerror(EIO)}));
}

}  // namespace
}  // namespace tamber
