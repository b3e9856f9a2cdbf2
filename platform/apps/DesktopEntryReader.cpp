#include "platform/apps/DesktopEntryReader.h"

#include <fcntl.h>
#include <gio/gdesktopappinfo.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <optional>

#include "platform/FileSystem.h"
#include "platform/ScopedFd.h"
#include "platform/apps/AppRecord.h"
#include "platform/objects/Dictionary.h"
#include "platform/objects/Number.h"
#include "support/Log.h"

namespace tamber {

namespace {

constexpr const char* kGroup = G_KEY_FILE_DESKTOP_GROUP;

struct KeyFileFree {
    void operator()(GKeyFile* keyFile) const { g_key_file_unref(keyFile); }
};
struct ObjectFree {
    void operator()(gpointer object) const { g_object_unref(object); }
};
struct GFree {
    void operator()(gpointer memory) const { g_free(memory); }
};
struct ErrorFree {
    void operator()(GError* error) const { g_error_free(error); }
};
using KeyFilePtr = std::unique_ptr<GKeyFile, KeyFileFree>;
using AppInfoPtr = std::unique_ptr<GDesktopAppInfo, ObjectFree>;
using GCharPtr = std::unique_ptr<gchar, GFree>;
using ErrorPtr = std::unique_ptr<GError, ErrorFree>;

// Non-empty text, or nothing.
std::optional<std::string> text(GCharPtr value) {
    if (!value || !*value)
        return std::nullopt;
    return std::string(value.get());
}

// The entry's keys, read through GIO for applications (which it accepted) and through the key
// file for the other types (which GIO does not load).
class Keys {
public:
    Keys(GKeyFile* keyFile, GDesktopAppInfo* app) : keyFile_(keyFile), app_(app) {}

    bool has(const char* key) const {
        return app_ ? g_desktop_app_info_has_key(app_, key)
                    : g_key_file_has_key(keyFile_, kGroup, key, nullptr);
    }
    std::optional<std::string> string(const char* key) const {
        return text(GCharPtr(app_ ? g_desktop_app_info_get_string(app_, key)
                                  : g_key_file_get_string(keyFile_, kGroup, key, nullptr)));
    }
    std::optional<std::string> localeString(const char* key) const {
        return text(
            GCharPtr(app_ ? g_desktop_app_info_get_locale_string(app_, key)
                          : g_key_file_get_locale_string(keyFile_, kGroup, key, nullptr, nullptr)));
    }
    // False when missing or not a boolean.
    bool boolean(const char* key) const {
        return app_ ? g_desktop_app_info_get_boolean(app_, key)
                    : g_key_file_get_boolean(keyFile_, kGroup, key, nullptr);
    }

private:
    GKeyFile* keyFile_;
    GDesktopAppInfo* app_;
};

// $HOME when it is an absolute path.
std::optional<std::string> homeDirectory() {
    const char* home = std::getenv("HOME");
    if (!home || home[0] != '/')
        return std::nullopt;
    return std::string(home);
}

std::optional<Url> dataContainer(const Keys& keys, const std::string& bundleIdentifier) {
    auto home = homeDirectory();
    if (keys.has(DesktopEntryReader::kDataContainerKey)) {
        // An explicit container that makes no sense means none, not a guess.
        std::string path = keys.string(DesktopEntryReader::kDataContainerKey).value_or("");
        if (path == "~" || path.starts_with("~/")) {
            if (!home)
                return std::nullopt;
            path = *home + path.substr(1);
        }
        if (!path.starts_with('/'))
            return std::nullopt;
        return Url::fileURLWithPath(path);
    }
    if (keys.has(DesktopEntryReader::kFlatpakKey) && home)
        return Url::fileURLWithPath(*home + "/.var/app/" + bundleIdentifier);
    return std::nullopt;
}

BundleRecord::Fields recordFields(const Keys& keys, const std::string& bundleIdentifier) {
    return {bundleIdentifier, keys.localeString(G_KEY_FILE_DESKTOP_KEY_NAME),
            dataContainer(keys, bundleIdentifier), keys.string(G_KEY_FILE_DESKTOP_KEY_ICON)};
}

AppRecord::AppFields appFields(const Keys& keys) {
    std::map<std::string, ObjectRef> info;
    if (keys.has(DesktopEntryReader::kSupportsDocumentBrowserKey))
        info[DesktopEntryReader::kHostSupportsDocumentBrowser] =
            Number::fromBool(keys.boolean(DesktopEntryReader::kSupportsDocumentBrowserKey));
    return {keys.boolean(DesktopEntryReader::kSupportsOpenInPlaceKey),
            keys.boolean(DesktopEntryReader::kFileSharingEnabledKey),
            Dictionary::make(std::move(info))};
}

// The freedesktop rule: an entry whose TryExec program is missing is for an application that
// is not installed, and is ignored.
bool tryExecMissing(GKeyFile* keyFile) {
    auto program = text(
        GCharPtr(g_key_file_get_string(keyFile, kGroup, G_KEY_FILE_DESKTOP_KEY_TRY_EXEC, nullptr)));
    return program && !GCharPtr(g_find_program_in_path(program->c_str()));
}

DesktopEntryReader::Entry unloadable(const std::string& origin, const std::string& reason) {
    logDebug([&] { return "can't load desktop entry " + origin + "; " + reason; });
    return {DesktopEntryReader::Outcome::Unloadable, nullptr};
}

}  // namespace

DesktopEntryReader::Entry DesktopEntryReader::parse(std::string_view contents,
                                                    const std::string& bundleIdentifier,
                                                    const std::string& origin) {
    KeyFilePtr keyFile(g_key_file_new());
    GError* rawError = nullptr;
    if (!g_key_file_load_from_data(keyFile.get(), contents.data(), contents.size(), G_KEY_FILE_NONE,
                                   &rawError)) {
        ErrorPtr error(rawError);
        return unloadable(origin, error ? error->message : "not a key file");
    }
    GCharPtr startGroup(g_key_file_get_start_group(keyFile.get()));
    if (!startGroup || std::strcmp(startGroup.get(), kGroup) != 0)
        return unloadable(origin, "it does not start with a Desktop Entry group");
    // Hidden means deleted; checked before anything that could fail.
    if (g_key_file_get_boolean(keyFile.get(), kGroup, G_KEY_FILE_DESKTOP_KEY_HIDDEN, nullptr))
        return {Outcome::Skipped, nullptr};
    auto type = text(GCharPtr(
        g_key_file_get_string(keyFile.get(), kGroup, G_KEY_FILE_DESKTOP_KEY_TYPE, nullptr)));
    if (!type)
        return unloadable(origin, "it has no type");

    if (*type != G_KEY_FILE_DESKTOP_TYPE_APPLICATION) {
        Keys keys(keyFile.get(), nullptr);
        return {Outcome::Record, BundleRecord::make(recordFields(keys, bundleIdentifier))};
    }
    AppInfoPtr app(g_desktop_app_info_new_from_keyfile(keyFile.get()));
    if (!app) {
        if (tryExecMissing(keyFile.get())) {
            logDebug([&] { return "desktop entry " + origin + " is for a missing program"; });
            return {Outcome::Skipped, nullptr};
        }
        return unloadable(origin, "GIO does not accept it as an application");
    }
    Keys keys(keyFile.get(), app.get());
    return {Outcome::Record,
            AppRecord::make(recordFields(keys, bundleIdentifier), appFields(keys))};
}

DesktopEntryReader::Entry DesktopEntryReader::readFile(const std::string& path,
                                                       const std::string& bundleIdentifier) {
    FileSystem& fs = FileSystem::current();
    // Non-blocking, in case the file was replaced by a FIFO since it was listed.
    ScopedFd fd(fs.open(path, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (!fd.ok()) {
        if (errno == ENOENT)
            return {Outcome::Skipped, nullptr};
        return unloadable(path, std::strerror(errno));
    }
    std::string contents;
    char buffer[16384];
    int error = 0;
    while (contents.size() <= kMaxEntrySize) {
        ssize_t n = fs.read(fd.get(), buffer, sizeof buffer);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            error = errno;
        if (n <= 0)
            break;
        contents.append(buffer, static_cast<size_t>(n));
    }
    if (error)
        return unloadable(path, std::strerror(error));
    if (contents.size() > kMaxEntrySize)
        return unloadable(path, "it is larger than " + std::to_string(kMaxEntrySize) + " bytes");
    return parse(contents, bundleIdentifier, path);
}

}  // namespace tamber
