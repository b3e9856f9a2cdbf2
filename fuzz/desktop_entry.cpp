// Feeds arbitrary bytes to the desktop-entry reader, as any package may install them. An entry
// becomes a record exactly when the outcome says so; the record carries the bundle identifier
// it was read for, a data container only as an absolute file URL; and the record must survive
// the app-library cache: archived and read back, it is the record it was.
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "fuzz/support/FuzzSupport.h"
#include "platform/apps/DesktopEntryReader.h"
#include "platform/archive/KeyedArchiver.h"
#include "platform/archive/KeyedUnarchiver.h"
#include "platform/objects/Object.h"

using namespace tamber;

namespace {

constexpr const char* kBundle = "org.example.Fuzz";

using fuzz::check;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static bool ready = [] {
        fuzz::silenceLog();
        // "~" and flatpak containers resolve against a fixed home.
        ::setenv("HOME", "/home/fuzz", 1);
        BundleRecord::registerArchiveClass();
        return true;
    }();
    (void)ready;
    std::string_view contents(reinterpret_cast<const char*>(data), size);
    DesktopEntryReader::Entry entry = DesktopEntryReader::parse(contents, kBundle, "fuzz");
    check((entry.outcome == DesktopEntryReader::Outcome::Record) == (entry.record != nullptr));
    if (!entry.record)
        return 0;
    const BundleRecord& record = *entry.record;
    check(record.bundleIdentifier() == std::string(kBundle));
    if (const auto& container = record.dataContainerURL())
        check(container->isFileURL() && container->path().starts_with('/'));

    // The cache archives the record as read (an application's is a subclass) and reads back
    // the plain record.
    auto archived = KeyedArchiver::archivedDataWithRootObject(entry.record);
    check(archived.ok());
    auto read = KeyedUnarchiver::unarchiveObjectWithData(archived.value());
    check(read.ok());
    auto decoded = objectCast<BundleRecord>(read.value());
    check(decoded && decoded->isEqual(*BundleRecord::make(record.fields())));
    return 0;
}
